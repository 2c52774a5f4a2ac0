// The kernel's timers behind a serial queue.

#include "platform/clock.h"
#include "platform/dispatch.h"

#include <gtest/gtest.h>

#include <vector>

namespace tally::platform {
namespace {

constexpr std::uint64_t millisecond = 1'000'000;

TEST(Timer, AddsUpWhatFallsDueWhileItsHandlerRuns) {
    SerialQueue queue("timer");
    Semaphore called;
    std::vector<std::uint64_t> ticks;
    std::unique_ptr<TimerSource> timer = dispatch_source_timer(queue, [&](std::uint64_t count) {
        ticks.push_back(count);
        const std::uint64_t end = clock_uptime_raw_approx_ns() + (ticks.size() == 1 ? 6 * millisecond : 0);
        while (clock_uptime_raw_approx_ns() < end) {
        }
        if (ticks.size() == 2) {
            timer->setTimer(~std::uint64_t{0}, 0, 0); // from the handler: never again, practically
        }
        called.signal();
    });
    timer->setTimer(0, 2 * millisecond, 0);
    called.wait();
    called.wait();
    queue.sync([] {});
    ASSERT_EQ(ticks.size(), 2U);
    EXPECT_GE(ticks[1], 2U); // of one that was kept for 6 ms
}

TEST(Timer, ACancelledOneStartsNothing) {
    SerialQueue queue("timer");
    Semaphore gate;
    int calls = 0;
    const std::unique_ptr<TimerSource> timer = dispatch_source_timer(queue, [&](std::uint64_t) { ++calls; });
    queue.async([&] { gate.wait(); });
    timer->setTimer(0, 1, 0); // due, and waiting behind the item
    timer->cancel();
    gate.signal();
    queue.sync([] {});
    EXPECT_EQ(calls, 0);
}

} // namespace
} // namespace tally::platform
