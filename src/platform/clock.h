// Clocks, and calendar dates as text.

#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace tally::platform {

/// One instant on three clocks.
struct mach_times {
    std::uint64_t absolute_ticks = 0;   // does not advance while the system sleeps
    std::uint64_t continuous_ticks = 0; // advances during sleep
    std::int64_t wall_seconds = 0;      // since 1970-01-01 00:00:00 UTC
    std::int64_t wall_nanoseconds = 0;
};

/// Reads the three clocks. @return 0, or non-zero on failure.
int mach_get_times(mach_times* times);

/// A monotonic clock that does not advance while the system sleeps; nanoseconds.
std::uint64_t clock_uptime_raw_approx_ns();

struct mach_timebase {
    std::uint32_t numer = 0; // nanoseconds = ticks * numer / denom
    std::uint32_t denom = 0;
};

void mach_timebase_info(mach_timebase* timebase);

/// `instant` in the local time zone: "2024-05-01 13:45:12.345+02:00", a zero offset as "Z". `separator`
/// stands between date and time.
std::string iso8601LocalDate(std::chrono::system_clock::time_point instant, char separator = ' ');

} // namespace tally::platform
