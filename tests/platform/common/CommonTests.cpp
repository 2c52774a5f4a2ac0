// What both platforms share: dates, error texts, serial queues.

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/kern_return.h"

#include <gtest/gtest.h>

#include <array>
#include <cstdlib>
#include <ctime>
#include <string>
#include <vector>

namespace tally::platform {
namespace {

TEST(LocalDate, GivesTheZonesOffsetAndCutsMilliseconds) {
    struct Case {
        const char* zone;
        std::int64_t milliseconds;
        const char* date;
    };
    const Case cases[] = {
        {"UTC0", 1'714'571'112'345, "2024-05-01 13:45:12.345Z"},
        {"CET-1CEST,M3.5.0,M10.5.0/3", 1'714'571'112'000, "2024-05-01 15:45:12.000+02:00"},
        {"CET-1CEST,M3.5.0,M10.5.0/3", 1'705'000'000'999, "2024-01-11 20:06:40.999+01:00"},
        {"NST3:30", 1'714'571'112'345, "2024-05-01 10:15:12.345-03:30"},
        {"UTC0", -1, "1969-12-31 23:59:59.999Z"},
    };
    for (const Case& expected : cases) {
        setenv("TZ", expected.zone, 1);
        tzset();
        const auto shortly = std::chrono::microseconds(999); // less than the date shows
        EXPECT_EQ(iso8601LocalDate(std::chrono::system_clock::time_point(
                      std::chrono::milliseconds(expected.milliseconds) + shortly)),
                  expected.date);
    }
    unsetenv("TZ");
    tzset();
}

TEST(SerialQueue, RunsAndDropsItemsInTheirOrder) {
    std::vector<std::string> events;
    struct Tellable {
        std::vector<std::string>* events;
        std::string name;
        ~Tellable() { events->push_back("drops " + name); }
    };
    Semaphore gate;
    {
        SerialQueue queue("queue");
        queue.async([&] { gate.wait(); });
        for (const char* name : {"a", "b"}) {
            queue.async([&events, item = std::make_shared<Tellable>(&events, name)] {
                events.push_back("runs " + item->name);
            });
        }
        gate.signal();
        queue.sync([&] { events.emplace_back("sync"); });
        queue.async([&] { events.emplace_back("last"); }); // the end of the queue waits for it
    }
    EXPECT_EQ(events, (std::vector<std::string>{"runs a", "drops a", "runs b", "drops b", "sync", "last"}));
}

TEST(ErrorTexts, SayWhatTheStatusMeans) {
    testing::internal::CaptureStderr();
    mach_error("mach_vm_region", KERN_INVALID_ARGUMENT);
    mach_error("task_read_for_pid", 12345);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "mach_vm_region: invalid argument\ntask_read_for_pid: unknown error code\n");
}

} // namespace
} // namespace tally::platform
