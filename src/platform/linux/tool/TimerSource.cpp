// Timers: the kernel counts the ticks, a thread hands them to the queue.

#include "platform/dispatch.h"

#include "platform/linux/io/Descriptor.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstdint>
#include <ctime>
#include <thread>
#include <utility>

namespace tally::platform {

namespace {

constexpr int longestSleep = 100; // milliseconds: the end is met also where the call that tells of it failed

timespec duration(std::uint64_t nanoseconds) {
    constexpr std::uint64_t perSecond = 1'000'000'000;
    // 0 would switch the timer, or its repetition, off.
    const std::uint64_t atLeastOne = std::max<std::uint64_t>(nanoseconds, 1);
    return {.tv_sec = static_cast<time_t>(atLeastOne / perSecond),
            .tv_nsec = static_cast<long>(atLeastOne % perSecond)};
}

class KernelTimer final : public TimerSource {
  public:
    KernelTimer(Descriptor timer, Descriptor end, SerialQueue& queue,
                std::function<void(std::uint64_t)> handler)
        : timer_(std::move(timer)), end_(std::move(end)), queue_(queue), handler_(std::move(handler)),
          thread_([this] { run(); }) {}

    ~KernelTimer() override {
        KernelTimer::cancel();
        thread_.join();
    }

    // The kernel's own timers need no leeway.
    void setTimer(std::uint64_t start, std::uint64_t interval, std::uint64_t /*leeway*/) override {
        isSet_ = true;
        const itimerspec setting{.it_interval = duration(interval), .it_value = duration(start)};
        timerfd_settime(timer_.number(), 0, &setting, nullptr);
    }

    void cancel() override {
        isCancelled_ = true;
        const std::uint64_t one = 1;
        [[maybe_unused]] const ssize_t written = write(end_.number(), &one, sizeof(one));
    }

  private:
    void run() {
        while (!isCancelled_) {
            std::array<pollfd, 2> events{pollfd{timer_.number(), POLLIN, 0},
                                         pollfd{end_.number(), POLLIN, 0}};
            std::uint64_t ticks = 0;
            if (poll(events.data(), events.size(), longestSleep) > 0 && (events[0].revents & POLLIN) != 0 &&
                read(timer_.number(), &ticks, sizeof(ticks)) == sizeof(ticks) && isSet_) {
                // Not read again before the handler has run: what falls due meanwhile adds up.
                queue_.sync([this, ticks] {
                    if (!isCancelled_) {
                        handler_(ticks);
                    }
                });
            }
        }
    }

    Descriptor timer_;
    Descriptor end_;
    SerialQueue& queue_;
    std::function<void(std::uint64_t)> handler_;
    std::atomic<bool> isCancelled_ = false;
    // What came before the setting comes before the handler: the descriptor says so to the kernel only.
    std::atomic<bool> isSet_ = false;
    std::thread thread_;
};

} // namespace

std::unique_ptr<TimerSource> dispatch_source_timer(SerialQueue& queue,
                                                   std::function<void(std::uint64_t)> handler) {
    Descriptor timer(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    Descriptor end(eventfd(0, EFD_CLOEXEC));
    if (!timer.isOpen() || !end.isOpen()) {
        return nullptr;
    }
    return std::make_unique<KernelTimer>(std::move(timer), std::move(end), queue, std::move(handler));
}

} // namespace tally::platform
