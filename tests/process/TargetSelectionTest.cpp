#include "process/TargetSelection.h"
#include "platform/scripted/ScriptedKernel.h"
#include "vm/PhysTallyCollection.h"

#include <gtest/gtest.h>

#include <cerrno>

namespace tally {
namespace {

using namespace platform;
using Pids = std::vector<std::int32_t>;

class TargetSelection : public testing::Test {
  protected:
    TargetSelection() { setPhysTallyCollectionEnabled(1); }

    /// Pid and name, "-" for the no-name marker, of each match; then the errors.
    static std::string matchesOf(const std::vector<std::string>& descriptions) {
        std::vector<std::string> errors;
        std::string text;
        for (const auto& [pid, name] :
             pidsForStringDescriptions(descriptions, &errors).value_or(TLTargetPids())) {
            text += std::to_string(pid) + ":" + name.value_or("-") + " ";
        }
        for (const std::string& error : errors) {
            text += error + " ";
        }
        return text;
    }

    ScriptedKernel kernel;
};

TEST_F(TargetSelection, MatchesNamesThenPids) {
    for (const auto& [pid, name] :
         {std::pair(10, "sh"), {20, "123"}, {30, "sh"}, {123, "server"}, {200, "123"}, {300, "30zip"}}) {
        kernel.addTask({.pid = pid, .name = name});
    }
    const std::string missing = "Unable to find pid for process matching ";
    EXPECT_EQ(matchesOf({"Sh", "sh"}), "10:sh 30:sh " + missing + "'Sh' ");
    EXPECT_EQ(matchesOf({"123"}), "20:123 200:123 ") << "names go before pids";
    EXPECT_EQ(matchesOf({"30zip"}), "300:30zip ");
    EXPECT_EQ(matchesOf({"123abc", " +30", "-10"}), "30:- 123:- " + missing + "'-10' ");
    EXPECT_EQ(matchesOf({"30", "sh", "10"}), "10:- 30:sh ") << "the last description of a pid counts";
    EXPECT_EQ(matchesOf({"", "4294967306"}), missing + "'' " + missing + "'4294967306' ") << "2^32 + 10";
    const std::size_t before = kernel.callCount("sysctl_procargs2");
    matchesOf({"sh", "server", "no"});
    EXPECT_EQ(kernel.callCount("sysctl_procargs2"), before + 6) << "a name is found out once";
}

TEST_F(TargetSelection, WorksOnAListThatMayChangeOrFail) {
    EXPECT_EQ(matchesOf({"sh"}), "Unable to obtain system process list ") << "no process was kept";
    for (const std::int32_t pid : {1, 2, 3}) {
        kernel.addTask({.pid = pid});
    }
    const auto startThirty = [&] { // ten more than there is room for
        for (std::int32_t pid = 100; pid < 130; ++pid) {
            kernel.addTask({.pid = pid});
        }
    };
    kernel.before("proc_listallpids", startThirty, {.nth = 2});
    kernel.before("proc_pidinfo", [&] { kernel.findTask(2)->exit(); }, {.nth = 2});
    const auto infos = copyAllBsdInfos();
    ASSERT_TRUE(infos);
    EXPECT_EQ(infos->size(), 22u);
    EXPECT_EQ((*infos)[1].pbi_pid, 3u);
    kernel.fail("proc_listallpids", EPERM, {.times = always});
    EXPECT_FALSE(allProcessesExcludingPids({}) || childPidsForPids(Pids{10}) ||
                 pidsForStringDescriptions({}, nullptr));
}

TEST_F(TargetSelection, FollowsChildrenLevelByLevelAndEndsOnCycles) {
    for (const auto& [pid, parent] :
         {std::pair(0, 0), {1, 0}, {10, 1}, {11, 20}, {12, 10}, {20, 1}, {21, 10}, {30, 31}, {31, 30}}) {
        kernel.addTask({.pid = pid, .parent = parent});
    }
    EXPECT_EQ(childPidsForPids(Pids{12}), Pids{12});
    EXPECT_EQ(childPidsForPids(Pids{0}), (Pids{0, 1, 10, 20, 11, 12, 21})) << "the list's order in a level";
    EXPECT_EQ(childPidsForPids(Pids{30}), (Pids{30, 31}));
    EXPECT_EQ(childPidsForPids(Pids{10, 99, 1, 10}), (Pids{10, 99, 1, 12, 20, 21, 11})) << "each once";
}

TEST_F(TargetSelection, LeavesOutWhatIsUnreadableOrCleanForIdleExit) {
    for (const std::int32_t flags : {0, 1, 6, 3, 7}) { // only both of the lower bits make a tracked one
        kernel.addTask({.pid = 10 + flags, .dirtyFlags = static_cast<std::uint32_t>(flags)});
    }
    kernel.addTask({.pid = 2});
    kernel.addTask({.pid = 3, .portStatus = KERN_NO_ACCESS, .usage = {.ri_resident_anonymous = 500}});
    kernel.addTask({.pid = 4, .portStatus = KERN_NO_ACCESS, .usage = {.ri_resident_anonymous = 20}});
    kernel.addTask({.pid = 5, .portStatus = KERN_FAILURE, .usage = {.ri_resident_anonymous = 7}}); // exited
    testing::internal::CaptureStderr();
    TLUnreadableProcesses unreadable;
    auto table = allProcessesExcludingPids({2, 77}, &unreadable);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
    ASSERT_TRUE(table);
    EXPECT_EQ(table->size(), 5u);
    EXPECT_EQ(unreadable.count, 2u);
    EXPECT_EQ(unreadable.residentAnonymous, 520u);
    EXPECT_EQ((*table)[16]->idleExitStatus(), TLIdleExitStatus::notTracked);
    EXPECT_EQ((*table)[17]->idleExitStatus(), TLIdleExitStatus::dirty);
    (*table)[99] = std::make_shared<TLProcess>(); // unknown
    const auto kept = removeIdleExitCleanProcessesFrom(*table);
    EXPECT_EQ(kept.size(), 5u);
    EXPECT_FALSE(kept.contains(13));
}

} // namespace
} // namespace tally
