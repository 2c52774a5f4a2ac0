#include "analysis/ProcessGrouping.h"
#include "analysis/ReadyProcess.h"

namespace tally {
namespace {

TLProcessGroupMinimal groupOf(const std::vector<std::int32_t>& pids) {
    TLProcessGroupMinimal group;
    for (const std::int32_t pid : pids) {
        group.addProcess(ready(pid, {}));
    }
    return group;
}

TEST(ProcessGroup, HashRunsOverMembersOnceAndMembersAreASet) {
    EXPECT_EQ(groupOf({5}).hash(), 698u);                     // 19 * 37 = 703 = ...111b; ^ 101b
    EXPECT_EQ(groupOf({5, 7}).hash(), 25829u);                // 698 * 37 = 25826 = ...010b; ^ 111b
    EXPECT_EQ(groupOf({5, 7, 5, 7, 7}).hash(), 25829u);       // members already
    EXPECT_EQ(groupOf({-1}).hash(), ~std::uint64_t{19 * 37}); // a pid is extended with its sign
    EXPECT_TRUE(groupOf({9, 3, 7, 3, 8, 9}).isEqual(groupOf({3, 7, 8, 9})));
    EXPECT_FALSE(groupOf({3, 7, 8}).isEqual(groupOf({3, 7, 8, 9})));
    EXPECT_FALSE(groupOf({3, 7}).isEqual(groupOf({3, 8})));
}

TEST(ProcessGroup, AnImmutableGroupIsFoundByItsMembersAndEqualOnlyToItself) {
    const auto group = TLProcessGroup::makeImmutableGroup(groupOf({5, 7}));
    EXPECT_EQ(group->hash(), groupOf({5, 7}).hash());
    EXPECT_TRUE(group->isEqual(groupOf({5, 7})) && groupOf({5, 7}).isEqual(*group));
    EXPECT_FALSE(group->isEqual(groupOf({5})));
    EXPECT_TRUE(group->isEqual(*group));
    EXPECT_FALSE(group->isEqual(*TLProcessGroup::makeImmutableGroup(groupOf({5, 7}))));
    EXPECT_DEATH(group->addProcess(ready(9, {})), "Attempt to add process to immutable TLProcessGroup");
}

TEST_F(AnalysisTest, ALargeGroupThatSeesTheSameIsSummedOnce) {
    for (const auto& [members, dirtyOfFirst, isCached] :
         {std::tuple{25, 1, false}, std::tuple{26, 1, true}, std::tuple{26, 2, false}}) {
        TLTally::ProcessList processes;
        for (std::int32_t pid = 1; pid <= members; ++pid) {
            const std::uint64_t dirty = pid == 1 ? dirtyOfFirst : 1;
            processes.push_back(
                ready(pid, {{.object = 7, .size = 4, .clean = 4},
                            {.object = 8, .size = 4, .dirty = dirty, .share_mode = platform::SM_SHARED}}));
        }
        TLTally tally(processes);
        tally.analyzeMemoryObjects();
        const ProcessGroups groups = groupProcesses(processes);
        TLProcessGroup& group = *groups.groupsOf(*processes[0]).at(0);
        const auto first = categoriesForGroup(group, *processes[0], false);
        EXPECT_EQ(first.hasProcessView, dirtyOfFirst == 2);
        for (std::size_t i = 1; i < processes.size(); ++i) {
            EXPECT_EQ(first.categories == categoriesForGroup(group, *processes[i], false).categories,
                      isCached);
        }
        // Every member has had its share.
        EXPECT_NE(first.categories, categoriesForGroup(group, *processes[0], false).categories);
    }
}

} // namespace
} // namespace tally
