// TLTime: one instant on three clocks.

#pragma once

#include "platform/clock.h"

#include <chrono>
#include <cstdint>
#include <optional>

namespace tally {

/// `ticks` in nanoseconds. The product wraps modulo 2^64; a timebase without a denominator gives 0.
std::uint64_t nanosecondsForTicks(std::uint64_t ticks, platform::mach_timebase timebase);

class TLTime {
  public:
    TLTime(std::uint64_t absolute, std::uint64_t continuous, double wallTime)
        : machAbsoluteTime_(absolute), machContinuousTime_(continuous), wallTime_(wallTime) {}

    /// The current instant; absent when the clocks cannot be read.
    static std::optional<TLTime> now();

    std::uint64_t machAbsoluteTime() const { return machAbsoluteTime_; }     // ticks
    std::uint64_t machContinuousTime() const { return machContinuousTime_; } // ticks, sleep included
    double wallTime() const { return wallTime_; } // seconds since 2001-01-01 00:00:00 UTC

    // Of a missing time stamp: 0, and no date.
    static std::uint64_t absoluteTimeNs(const std::optional<TLTime>& time);
    static std::uint64_t continuousTimeNs(const std::optional<TLTime>& time);
    static std::optional<std::chrono::system_clock::time_point> date(const std::optional<TLTime>& time);

  private:
    std::uint64_t machAbsoluteTime_;
    std::uint64_t machContinuousTime_;
    double wallTime_;
};

} // namespace tally
