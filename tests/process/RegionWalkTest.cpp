#include "vm/RegionWalk.h"
#include "WalkTest.h"

#include <cerrno>

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t base = 0x180000000;

using RegionWalk = WalkTest;

// The cache is the same for everyone: its submap is not descended into.
TEST_F(RegionWalk, PassesOverTheSharedCacheWithOneQuery) {
    task.sharedCache = dyld_shared_cache{.uuid = {8}, .base_address = base, .mapped_size = 0x4000000};
    task.map({.start = 0x10000000, .pages = "D"});
    task.map({.start = base - 0x1000, .pages = "D"}); // the last private mapping
    task.map({.start = base, .nested = {{.size = 0x1000000}, {.size = 0x3000000}}});
    task.map({.start = base + 0x8000000, .pages = "D"});
    EXPECT_EQ(walkedLines().at(2), "180000000+4000000 unused dyld shared cache area @0 gap");
    EXPECT_EQ(kernel.callCount("mach_vm_region_recurse"), 4u) << "three mappings and the end";
    EXPECT_EQ(lastNonSharedCacheRegion(process->makeWalk()), base - 0x1000);
    task.unmap(base - 0x1000);
    EXPECT_EQ(lastNonSharedCacheRegion(process->makeWalk()), 0x10000000u);
}

TEST_F(RegionWalk, EndsWhereTheKernelRefusesAndKeepsWhatItHas) {
    // The failure of the second query (0: what the task's end makes of it), the task's state from then on,
    // whether the target is a process, the ending of the message, and whether that is a warning.
    const std::tuple<kern_return_t, TaskState, bool, const char*, bool> cases[] = {
        {KERN_INVALID_ADDRESS, TaskState::alive, true, nullptr, false}, // the end of the address space
        {KERN_FAILURE, TaskState::alive, true, "", false},
        {KERN_FAILURE, TaskState::zombie, false, "", false},
        {0, TaskState::zombie, true, " (zombie)", true},
        {0, TaskState::gone, true, " (process exited)", true},
    };
    for (const auto& [failure, state, alive, ending, isWarning] : cases) {
        ScriptedTask& target = kernel.addTask({.pid = 7, .name = "p"});
        target.map({.pages = "D"});
        target.map({.pages = "D"});
        kernel.before("mach_vm_region_recurse", [&, next = state] { target.state = next; }, {.nth = 2});
        if (failure != 0) {
            kernel.fail("mach_vm_region_recurse", failure, {.nth = 2});
        }
        testing::internal::CaptureStderr();
        EXPECT_EQ(walk(false, alive).size(), 1u) << ending;
        const std::string printed = testing::internal::GetCapturedStderr();
        const std::string reason = mach_error_string(failure == 0 ? KERN_INVALID_ARGUMENT : failure);
        const Lines message = ending == nullptr ? Lines{} : Lines{"p [7]: " + reason + ending};
        EXPECT_EQ(process->warnings(), isWarning ? message : Lines{});
        EXPECT_EQ(process->errors(), isWarning ? Lines{} : message);
        EXPECT_EQ(printed, message.empty()
                               ? ""
                               : "mach_vm_region_recurse: " + reason +
                                     "\nbailing out for process p [7]; data may be incomplete!\n");
    }
}

TEST_F(RegionWalk, AsksForThePagesOfSharedMappingsInChunksAndDropsHalfAnAnswer) {
    const std::string pages = std::string(4095, '.') + "DDD" + std::string(4094, '.') + "C";
    task.map({.pages = pages, .offset = 0x1000000, .shareMode = SM_SHARED});
    Lines runs;
    const TLRangeList* const list = walk().at(0).subrangeList.get();
    for (const auto* node = list ? list->rangeListHead() : nullptr; node; node = node->next.get()) {
        runs.push_back(describeRange(formatted("%lx", node->start), node->size, "", node->sizes));
    }
    EXPECT_EQ(runs, (Lines{"1fff000+3000 d3000", "3000000+1000 c1000"}));
    EXPECT_EQ(kernel.callCount("mach_vm_page_range_query"), 3u) << "4096 pages a query";
    // Some of the runs would count for less than the mapping's own figures.
    kernel.fail("mach_vm_page_range_query", KERN_FAILURE, {.nth = 2});
    testing::internal::CaptureStderr();
    EXPECT_FALSE(walk().at(0).subrangeList);
    const std::string reason = mach_error_string(KERN_FAILURE);
    EXPECT_EQ(process->errors(), Lines{"p [7]: " + reason});
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "mach_vm_page_range_query: " + reason + "\n");
}

/// Task 7 maps a cache of pages of 16 KiB, in which a library has these segments.
class SharedCachePieces : public WalkTest {
  protected:
    explicit SharedCachePieces(std::vector<RKSegment> segments = {{base, 0x3000, "__TEXT"},
                                                                  {base + 0x5000, 0x4000, "__DATA"},
                                                                  {base + 0x9000, 0x2800, "__B"}}) {
        kernel.pageSize = 0x4000;
        task.sharedCache = dyld_shared_cache{.uuid = {7}, .base_address = base, .mapped_size = 0x40000};
        task.images.push_back({"/lib", base, std::move(segments)});
        task.map({.start = base, .pages = "DDSD", .externalPager = true});
        task.map({.start = base + 0x100000, .pages = "D"});
    }
};

// A gap's last page is settled by the data after it, whose own last page is not asked for again. The last
// piece takes the padding up to its alignment; the gap after it is whole pages, so nothing is asked.
TEST_F(SharedCachePieces, ShareThePagesInWhichTheyMeetToTheByte) {
    const std::string unused = " unused dyld shared cache area ";
    EXPECT_EQ(
        walkedLines(),
        (Lines{"180000000+3000 __TEXT /lib @2", "180003000+2000" + unused + "d1000 @3 gap",
               "180005000+4000 __DATA /lib d3000 s1000 @3", "180009000+3000 __B /lib s3000 @3",
               "18000c000+4000" + unused + "@3 gap", "180100000+4000 untagged (\"VM_ALLOCATE\") d4000"}));
    EXPECT_EQ(kernel.callCount("mach_vm_page_range_query"), 1u);
}

TEST_F(SharedCachePieces, EndTheWalkWhenTheirPagesCannotBeRead) {
    kernel.fail("mach_vm_page_range_query", KERN_FAILURE);
    testing::internal::CaptureStderr();
    EXPECT_EQ(walkedLines().size(), 2u) << "what comes before it";
    EXPECT_TRUE(testing::internal::GetCapturedStderr().ends_with(
        "\nbailing out for process p [7]; data may be incomplete!\n"));
}

} // namespace
} // namespace tally
