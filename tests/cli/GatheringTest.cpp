#include "analysis/TLTally.h"
#include "platform/scripted/ScriptedKernel.h"

#include <gtest/gtest.h>

namespace tally {
namespace {

/// A process whose gathering is a function.
struct FakeProcess final : TLProcess {
    std::function<void(std::int32_t)> gather;
    void gatherData() override { gather(pid()); }
};

/// The processes 1 to `count`, in no order.
TLTally::ProcessList processes(std::int32_t count, const std::function<void(std::int32_t)>& gather) {
    TLTally::ProcessList list;
    for (std::int32_t i = 0; i < count; ++i) {
        auto process = std::make_shared<FakeProcess>();
        process->setPid(i * 73 % count + 1); // all different as long as 73 does not divide the count
        process->gather = gather;
        list.push_back(process);
    }
    return list;
}

TEST(ThreadGather, StartsHighPidsFirstAndWaitsForAll) {
    platform::ScriptedKernel kernel;
    std::atomic<bool> hasFirstStarted = false;
    std::atomic<bool> isInOrder = true;
    std::atomic<int> gathered = 0;
    TLTally tally(processes(200, [&](std::int32_t pid) {
        // Whoever is early takes a worker and waits for the first one, so a wrong order ends in the limit.
        if (pid == 200) {
            hasFirstStarted = true;
        }
        const auto limit = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while (!hasFirstStarted && isInOrder) {
            isInOrder = std::chrono::steady_clock::now() < limit;
        }
        ++gathered;
    }));
    EXPECT_FALSE(tally.gatherAllProcesses());
    EXPECT_TRUE(isInOrder);
    EXPECT_EQ(gathered, 200);
    EXPECT_EQ(tally.processes()[1]->pid(), 74); // the list itself stays as it was
    EXPECT_LT(tally.gatherStartTime()->machAbsoluteTime(), tally.gatherEndTime()->machAbsoluteTime());
}

TEST(ThreadGather, AnInterruptStartsNoMore) {
    for (const bool beforeTheGather : {true, false}) {
        platform::ScriptedKernel kernel;
        std::atomic<int> gathered = 0;
        std::atomic<bool>* earlyExit = nullptr;
        TLTally tally(processes(5000, [&](std::int32_t) {
            ++gathered;
            *earlyExit = true;
        }));
        for (const auto& process : tally.processes()) {
            process->setHiddenFromDisplay(process->pid() < 3 || process->pid() == 4);
        }
        earlyExit = &tally.earlyExit;
        tally.earlyExit = beforeTheGather;
        EXPECT_TRUE(tally.gatherAllProcesses());
        EXPECT_EQ(gathered == 0, beforeTheGather);
        EXPECT_LT(gathered, 2500);
        for (const auto& process : tally.processes()) {
            EXPECT_EQ(process->globalErrors().size(), process->pid() == 3 ? 1 : 0) << process->pid();
        }
        EXPECT_TRUE(tally.gatherEndTime());
    }
}

} // namespace
} // namespace tally
