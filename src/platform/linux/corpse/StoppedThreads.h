// StoppedThreads: a process that holds still while it is looked at.
//
// Its threads are seized by ptrace, interrupted and awaited, until a look at the list of threads finds no new
// one. They stay seized no longer than the thread of the tool that seized them lives: however that ends, the
// kernel lets go of them. Processes that share the memory without being threads of the process run on.
//
// When a thread loads another program, the kernel ends the other threads and waits until their tracer has
// taken note of it. To seize one more thread would be to wait for that very program. So a second thread of
// the tool takes note.

#pragma once

#include "platform/kern_return.h"

#include <chrono>
#include <cstdint>
#include <map>
#include <mutex>
#include <set>

namespace tally::platform {

/// The threads that are seized, for the thread of the tool that takes note of their ends.
class SeizedThreads {
  public:
    void add(std::int32_t id);
    /// To be called again and again while the others are stopped.
    void takeNoteOfEnds();

  private:
    std::mutex mutex_;
    std::set<std::int32_t> ids_;
};

/// How long threads are given to hold still: a second in which the tool looks at them again and again. On a
/// busy machine neither they nor the tool run all of the time; what is beyond a usual round does not count,
/// up to a limit.
class Patience {
  public:
    /// To be called once a round. @return whether it is at an end.
    bool isOver();

  private:
    using Clock = std::chrono::steady_clock;

    Clock::time_point begin_ = Clock::now();
    Clock::time_point last_ = begin_;
    Clock::duration spent_{};
};

class StoppedThreads {
  public:
    /// Stops all threads of process `pid`. To be made by a thread that ends soon after.
    StoppedThreads(std::int32_t pid, SeizedThreads& seized);
    /// Lets the threads go on, with the signals that were on their way to them.
    ~StoppedThreads();
    StoppedThreads(const StoppedThreads&) = delete;
    StoppedThreads& operator=(const StoppedThreads&) = delete;

    /// KERN_SUCCESS when all threads hold still; KERN_NO_ACCESS, KERN_RIGHT_EXISTS when another process
    /// traces them, KERN_TERMINATED, or KERN_OPERATION_TIMED_OUT when one does not react.
    kern_return_t status() const { return status_; }

  private:
    struct Thread {
        enum class State : std::uint8_t { running, stopped, gone } state = State::running;
        int signal = 0; // that it was about to take
    };

    kern_return_t stopAll();
    kern_return_t seizeNewThreads(bool* isNew, Patience& patience);
    bool isStillKnown(std::int32_t id) const;
    kern_return_t seize(std::int32_t id, Patience& patience);
    bool awaitThreads(Patience& patience);
    bool look(std::int32_t id, Thread& thread);

    std::int32_t pid_;
    SeizedThreads& seized_;
    std::map<std::int32_t, Thread> threads_;
    kern_return_t status_;
};

} // namespace tally::platform
