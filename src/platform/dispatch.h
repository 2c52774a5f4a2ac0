// Work queues, semaphores, and the sources that call a handler: signals and timers.

#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

namespace tally::platform {

// Quality-of-service classes of a queue. Nothing on Linux follows them.
inline constexpr std::uint32_t QOS_CLASS_UTILITY = 0x11;
inline constexpr std::uint32_t QOS_CLASS_DEFAULT = 0x15;
inline constexpr std::uint32_t QOS_CLASS_USER_INITIATED = 0x19;

/// A queue that runs its items on all processors.
struct ConcurrentQueue {
    std::string label;
    std::uint32_t qualityOfService = QOS_CLASS_UTILITY;
};

/// Runs `item(0)` to `item(count - 1)`, started in index order, as many at a time as there are processors,
/// and returns when all have finished. An item that throws ends the program.
void dispatch_apply(std::size_t count, const ConcurrentQueue& queue,
                    const std::function<void(std::size_t)>& item);

/// A queue that runs its items one after another, in the order of their coming, on a thread of its own.
/// Thread-safe. An item must not throw.
class SerialQueue {
  public:
    explicit SerialQueue(std::string label, std::uint32_t qualityOfService = QOS_CLASS_DEFAULT);
    /// Runs what is still queued and returns.
    ~SerialQueue();
    SerialQueue(const SerialQueue&) = delete;
    SerialQueue& operator=(const SerialQueue&) = delete;

    /// Queues `item`. It is destroyed once it has run, before the next one begins.
    void async(std::function<void()> item);
    /// Queues `item` and returns once it has run. Not from an item of the same queue.
    void sync(const std::function<void()>& item);

    const std::string label;
    const std::uint32_t qualityOfService;

  private:
    void run();

    std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<std::function<void()>> items_;
    bool isEnding_ = false;
    std::thread thread_;
};

/// A counting semaphore that begins at 0.
class Semaphore {
  public:
    void signal();
    /// Waits until the count is positive and takes one off.
    void wait();

  private:
    std::mutex mutex_;
    std::condition_variable raised_;
    std::uint64_t count_ = 0;
};

/// A timer whose handler runs on a serial queue. Ticks that fall due while the handler has not come to run
/// are one call of it.
class TimerSource {
  public:
    virtual ~TimerSource() = default;
    /// Lets the timer fire first `start` from now and then every `interval`, at most `leeway` late; all in
    /// nanoseconds, an interval of 0 counts as 1. Ticks of an earlier setting are forgotten.
    virtual void setTimer(std::uint64_t start, std::uint64_t interval, std::uint64_t leeway) = 0;
    /// Starts no more calls of the handler; does not wait for a running one, as the destructor does.
    virtual void cancel() = 0;
};

/// Makes a timer, which fires once it is set. The handler gets the number of ticks since its last call. The
/// queue must outlive the timer.
/// @return null when the system refuses one.
std::unique_ptr<TimerSource> dispatch_source_timer(SerialQueue& queue,
                                                   std::function<void(std::uint64_t)> handler);

/// A started source that calls its handler on a thread of its own for every signal; while one exists the
/// signal does not end the program.
class SignalSource {
  public:
    virtual ~SignalSource() = default;
    /// Stops calling the handler; returns once a running call has finished. The destructor does the same. The
    /// signal's action is not changed.
    virtual void cancel() = 0;
};

enum class InterruptSignals {
    sigint,
    sigintAndTermination, // SIGTERM and SIGHUP too; one that was ignored from the start stays so
};

/// Starts a source for interrupts. One exists at a time. @return null when the system refuses one.
std::unique_ptr<SignalSource> dispatch_source_interrupt(InterruptSignals which,
                                                        std::function<void()> handler);

/// Lets the signals of the last source end the program again.
void restoreDefaultInterruptAction();

} // namespace tally::platform
