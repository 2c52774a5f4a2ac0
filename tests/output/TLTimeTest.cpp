#include "report/TLTime.h"
#include "platform/scripted/ScriptedKernel.h"

#include <gtest/gtest.h>

namespace tally {
namespace {

TEST(TLTime, ConvertsTicks) {
    EXPECT_EQ(nanosecondsForTicks(24'000'000, {125, 3}), 1'000'000'000u);
    EXPECT_EQ(nanosecondsForTicks(24'000'001, {1, 1}), 24'000'001u);
    EXPECT_EQ(nanosecondsForTicks(std::uint64_t{1} << 63 | 3, {2, 1}), 6u); // the product wraps
    EXPECT_EQ(nanosecondsForTicks(5, {1, 0}), 0u);
}

TEST(TLTime, TakesThreeReadingsOfOneInstant) {
    platform::ScriptedKernel kernel;
    kernel.ticksBetweenReadings = 0;
    kernel.times = {11, 22, 978307201, 500'000'000};
    const std::optional<TLTime> now = TLTime::now();
    EXPECT_EQ(now.value().wallTime(), 1.5); // since 2001
    EXPECT_EQ(TLTime::absoluteTimeNs(now), 11u);
    EXPECT_EQ(TLTime::continuousTimeNs(now), 22u);
    kernel.times = {};
    EXPECT_EQ(TLTime::now().value().wallTime(), -978307200.0);
    kernel.fail("mach_get_times", 5);
    EXPECT_FALSE(TLTime::now());
    EXPECT_EQ(TLTime::continuousTimeNs(std::nullopt), 0u);
    EXPECT_FALSE(TLTime::date(std::nullopt));
}

TEST(TLTime, ADateKeepsItsMilliseconds) {
    EXPECT_EQ(TLTime::date(TLTime(0, 0, 1.5)).value().time_since_epoch(),
              std::chrono::milliseconds(978307201500));
    for (int milliseconds = 0; milliseconds < 1000; ++milliseconds) {
        const auto date = TLTime::date(TLTime(0, 0, 700000000 + milliseconds / 1000.0)).value();
        EXPECT_EQ(date.time_since_epoch() % std::chrono::seconds(1), std::chrono::milliseconds(milliseconds));
    }
}

} // namespace
} // namespace tally
