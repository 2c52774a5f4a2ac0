// The three clocks; a tick is a nanosecond.

#include "platform/clock.h"

#include <ctime>

namespace tally::platform {

namespace {

constexpr std::uint64_t nanosecondsPerSecond = 1'000'000'000;

bool readTicks(clockid_t clock, std::uint64_t* ticks) {
    timespec now{};
    if (clock_gettime(clock, &now) != 0) {
        return false;
    }
    *ticks = static_cast<std::uint64_t>(now.tv_sec) * nanosecondsPerSecond +
             static_cast<std::uint64_t>(now.tv_nsec);
    return true;
}

} // namespace

int mach_get_times(mach_times* times) {
    timespec wall{};
    if (!readTicks(CLOCK_MONOTONIC, &times->absolute_ticks) ||
        !readTicks(CLOCK_BOOTTIME, &times->continuous_ticks) || clock_gettime(CLOCK_REALTIME, &wall) != 0) {
        return -1;
    }
    times->wall_seconds = wall.tv_sec;
    times->wall_nanoseconds = wall.tv_nsec;
    return 0;
}

std::uint64_t clock_uptime_raw_approx_ns() {
    std::uint64_t now = 0;
    readTicks(CLOCK_MONOTONIC, &now);
    return now;
}

void mach_timebase_info(mach_timebase* timebase) { *timebase = {1, 1}; }

} // namespace tally::platform
