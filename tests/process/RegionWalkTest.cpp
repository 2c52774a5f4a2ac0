#include "vm/RegionWalk.h"
#include "WalkTest.h"

#include <cerrno>

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t base = 0x180000000;

class RegionWalk : public WalkTest {
  protected:
    /// The pieces of a shared mapping, by their offset in the object, which begins 0x100000 before it.
    Lines subrangesOf(const PageStates& pages, std::uint8_t shareMode = SM_SHARED, bool hidden = false) {
        task.map({.start = 0x10000,
                  .pages = pages,
                  .object = 5,
                  .offset = 0x100000,
                  .shareMode = shareMode,
                  .externalPager = true,
                  .wiredCount = shareMode == SM_LARGE_PAGE});
        const TLRangeList* const list = walk(hidden).at(0).subrangeList.get();
        task.unmap(0x10000);
        Lines lines;
        for (const auto* node = list ? list->rangeListHead() : nullptr; node; node = node->next.get()) {
            lines.push_back(describeRange(formatted("%lx", node->start), node->size, "", node->sizes));
        }
        return lines;
    }
};

TEST_F(RegionWalk, SizesMappingsByTheirCounts) {
    const PageCounts contradiction{.resident = 1, .dirtied = 1, .reusable = 2};
    const std::pair<ScriptedMapping, std::string> cases[] = {
        // as charged to a process / as the object sees
        {{.tag = 90, .pages = "DDC.RS"}, "audio d2000 s1000 c1000 r1000 / audio d3000 s1000 r1000"},
        {{.pages = "DCC", .externalPager = true}, "mapped file d1000 c2000 / mapped file d1000 c2000"},
        {{.tag = 90, .pages = "DDS", .purgeable = VM_PURGABLE_VOLATILE}, "audio r2000 / audio r2000"},
        {{.tag = 90, .pages = "DD.", .purgeable = VM_PURGABLE_EMPTY}, "audio r3000 / audio r3000"},
        {{.tag = 90, .pages = "D", .purgeable = 2, .purgeableStatus = 5}, "audio d1000 / audio d1000"},
        {{.size = 0x4000, .tag = 90, .pages = contradiction}, "audio d1000 r2000 / audio r2000"},
        {{.tag = 90, .pages = "D", .wiredCount = 3}, "audio d1000 w1000 / audio d1000 w1000"},
    };
    for (const auto& [mapping, expected] : cases) {
        task.map(mapping);
        setPhysTallyCollectionEnabled(1);
        const std::string charged = walkedLines().at(0);
        setPhysTallyCollectionEnabled(0);
        const std::string seen = walkedLines().at(0);
        EXPECT_EQ(charged.substr(charged.find(' ') + 1) + " /" + seen.substr(seen.find(' ')), expected);
        task.unmap(0x10000);
    }
}

TEST_F(RegionWalk, NamesMappingsByImageFileReservedAreaOrTag) {
    task.images = {{"/bin/p", 0x10000, {{0x13000, 1, ""}, {0x10800, 1, "__DATA x"}, {0x14000, 0, "__A"}}}};
    task.resolvedPaths = {{"/bin/p", "/bin/real"}};
    task.map({.pages = "D", .file = "/bin/p"});
    task.map({.pages = "D", .file = "/a b\n\xff (deleted)"});
    task.map({.tag = 30, .pages = "D"});
    task.map({.pages = "D"});
    task.map({.tag = 30, .pages = "D"});
    task.map({.start = 0xFC0000000, .size = 0x40000000});
    task.map({.start = 0x1000000000, .size = 0x6000000000 - 0x1000});
    EXPECT_EQ(
        walkedLines(),
        (Lines{"10000+1000 __DATA /bin/real d1000 #3", "11000+1000 mapped file /a b\n\xff (deleted) d1000",
               "12000+1000 stack d1000", "13000+1000 unknown /bin/real d1000", "14000+1000 stack d1000",
               "fc0000000+40000000 commpage (reserved) verbose",
               "1000000000+5ffffff000 untagged (\"VM_ALLOCATE\")"}));
    // What cannot be asked has no file name.
    EXPECT_EQ(walkedLines(false, /*alive=*/false).at(1), "11000+1000 mapped file d1000");
}

TEST_F(RegionWalk, DescendsIntoSubmapsAndKeepsShortIds) {
    kernel.submapInfoCount = VM_REGION_SUBMAP_INFO_V1_COUNT_64;
    task.map({.pages = "D", .object = 0x300000005, .offset = 0x7000});
    task.map({.nested = {{.pages = "D", .object = 6}, {.nested = {{.pages = "C", .object = 7}}}}});
    const auto& regions = walk();
    ASSERT_EQ(regions.size(), 3u);
    EXPECT_EQ(regions[0].object_id, 5u);
    EXPECT_EQ(regions[0].offset, 0x7000u);
    EXPECT_EQ(regions[2].object_id, 7u);
}

// The cache is the same for everyone: its submap is not descended into.
TEST_F(RegionWalk, PassesOverTheSharedCacheWithOneQuery) {
    task.sharedCache = dyld_shared_cache{.uuid = {8}, .base_address = base, .mapped_size = 0x4000000};
    task.map({.start = 0x10000000, .pages = "D"});
    task.map({.start = base - 0x1000, .pages = "D"}); // the last private mapping
    task.map({.start = base, .nested = {{.size = 0x1000000}, {.size = 0x1000000}, {.size = 0x2000000}}});
    task.map({.start = base + 0x8000000, .pages = "D"});
    const auto& regions = walk();
    ASSERT_EQ(regions.size(), 4u);
    EXPECT_EQ(describe(regions[2]), "180000000+4000000 unused dyld shared cache area @0 gap");
    EXPECT_EQ(regions[2].object_id, 1u);
    EXPECT_EQ(kernel.callCount("mach_vm_region_recurse"), 4u) << "three mappings and the end";
    EXPECT_EQ(lastNonSharedCacheRegion(*process), base - 0x1000);
    task.unmap(base - 0x1000);
    EXPECT_EQ(lastNonSharedCacheRegion(*process), 0x10000000u);
    task.unmap(0x10000000);
    EXPECT_EQ(walk().size(), 4u) << "with nothing below it the submap is walked";
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

// Runs of two states that touch become one piece; their counters tell them apart.
TEST_F(RegionWalk, SplitsSharedMappingsIntoRunsOfPages) {
    EXPECT_EQ(subrangesOf(".DD.SR..C"),
              (Lines{"101000+2000 d2000", "104000+2000 s1000 r1000", "108000+1000 c1000"}));
    const std::int32_t dirty = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
    EXPECT_EQ(subrangesOf(std::vector<std::int32_t>{dirty | VM_PAGE_QUERY_PAGE_PAGED_OUT, 0,
                                                    dirty | VM_PAGE_QUERY_PAGE_REUSABLE}),
              (Lines{"100000+1000 s1000", "102000+1000 d1000"}));
    EXPECT_EQ(subrangesOf("D.C", SM_COW, /*hidden=*/true), Lines{});
    EXPECT_EQ(subrangesOf("D.C", SM_PRIVATE), Lines{});
    EXPECT_EQ(subrangesOf("...", SM_COW), Lines{});
    EXPECT_EQ(subrangesOf("CCC", SM_COW), Lines{});
    EXPECT_EQ(subrangesOf("DD.", SM_LARGE_PAGE), Lines{"100000+2000 d2000 w2000"});
    EXPECT_EQ(kernel.callCount("mach_vm_page_range_query"), 3u);
    const std::string pages = std::string(4095, '.') + "DDD" + std::string(4094, '.') + "C";
    EXPECT_EQ(subrangesOf(pages), (Lines{"10ff000+3000 d3000", "2100000+1000 c1000"}));
    EXPECT_EQ(kernel.callCount("mach_vm_page_range_query"), 6u) << "4096 pages a query";
    // Some of the runs would count for less than the mapping's own figures.
    kernel.fail("mach_vm_page_range_query", KERN_FAILURE, {.nth = 2});
    testing::internal::CaptureStderr();
    const std::string reason = mach_error_string(KERN_FAILURE);
    EXPECT_EQ(subrangesOf("D" + pages), Lines{});
    EXPECT_EQ(process->errors(), Lines{"p [7]: " + reason});
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "mach_vm_page_range_query: " + reason + "\n");
    task.images = {{"/lib", 0x10000, {{0x10000, 0x3000, "__DATA"}}}};
    EXPECT_EQ(subrangesOf("D.C"), Lines{}) << "private to each process";
    task.images.clear();
    setPhysTallyCollectionEnabled(0);
    EXPECT_EQ(subrangesOf("D.C"), Lines{});
}

} // namespace
} // namespace tally
