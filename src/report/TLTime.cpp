// TLTime: reading the clocks and turning ticks and wall time into what reports print.

#include "report/TLTime.h"

namespace tally {

namespace {

constexpr double secondsFrom1970To2001 = 978307200.0;

std::uint64_t nanosecondsOfClock(std::uint64_t ticks) {
    static const platform::mach_timebase timebase = [] {
        platform::mach_timebase fetched;
        platform::mach_timebase_info(&fetched);
        return fetched;
    }();
    return nanosecondsForTicks(ticks, timebase);
}

} // namespace

std::uint64_t nanosecondsForTicks(std::uint64_t ticks, platform::mach_timebase timebase) {
    return timebase.denom == 0 ? 0 : ticks * timebase.numer / timebase.denom;
}

std::optional<TLTime> TLTime::now() {
    platform::mach_times times;
    if (platform::mach_get_times(&times) != 0) {
        return std::nullopt;
    }
    const double wallTime = (static_cast<double>(times.wall_seconds) - secondsFrom1970To2001) +
                            static_cast<double>(times.wall_nanoseconds) * 1e-9;
    return TLTime(times.absolute_ticks, times.continuous_ticks, wallTime);
}

std::uint64_t TLTime::absoluteTimeNs(const std::optional<TLTime>& time) {
    return time ? nanosecondsOfClock(time->machAbsoluteTime_) : 0;
}

std::uint64_t TLTime::continuousTimeNs(const std::optional<TLTime>& time) {
    return time ? nanosecondsOfClock(time->machContinuousTime_) : 0;
}

std::optional<std::chrono::system_clock::time_point> TLTime::date(const std::optional<TLTime>& time) {
    if (!time) {
        return std::nullopt;
    }
    // A double tells today's dates apart to a tenth of a microsecond; without rounding .345 s could print as
    // .344.
    const std::chrono::duration<double> since1970(time->wallTime_ + secondsFrom1970To2001);
    return std::chrono::system_clock::time_point(std::chrono::round<std::chrono::microseconds>(since1970));
}

} // namespace tally
