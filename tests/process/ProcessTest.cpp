#include "platform/scripted/ScriptedKernel.h"
#include "process/TLProcess.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <fstream>

namespace tally {
namespace {

using namespace platform;
using namespace std::string_literals;

TEST(ProcessName, ComesFromTheExecutableElseFromTheRecord) {
    const std::string longName(40, 'n');
    const std::pair<TaskRecord, std::string> cases[] = {
        {{.name = "record", .path = "/usr/libexec/foo"}, "foo"},
        {{.name = "record", .path = "/a b\n\xff (x)"}, "a b\n\xff (x)"},
        {{.name = "record", .argumentArea = "\1\0\0\0\0\0\0\0/a/b\0c"s}, "b"}, // padded
        {{.name = "record", .argumentArea = "\1\0\0\0bc"s}, "b"},              // no slash, cut off
        {{.name = "record", .argumentArea = ""}, "record"},
        {{.name = "record", .argumentArea = "\1\0\0\0\0"s}, "record"},
        {{.name = "record", .argumentArea = "\1\0\0\0/a/\0"s}, "record"},
        {{.name = longName, .argumentArea = ""}, longName.substr(0, 32)}, // fields without a NUL
        {{.comm = longName, .argumentArea = ""}, longName.substr(0, 16)},
        {{.argumentArea = ""}, "Unknown"},
    };
    ScriptedKernel kernel;
    proc_bsdinfo info;
    for (const auto& [task, expected] : cases) {
        TaskRecord record = task;
        record.pid = 5;
        kernel.addTask(record);
        proc_pidinfo(5, &info);
        EXPECT_EQ(TLProcess::nameForBsdInfo(info), expected);
    }
    kernel.addTask({.pid = 5, .name = "record", .path = "/bin/foo"});
    proc_pidinfo(5, &info);
    for (const char* call : {"sysctl_argmax", "sysctl_procargs2"}) {
        kernel.fail(call, EPERM);
        EXPECT_EQ(TLProcess::nameForBsdInfo(info), "record") << call;
    }
}

TEST(Process, IsMadeOfItsIdentityOrRefused) {
    ScriptedKernel kernel;
    kernel.addTask({.pid = 6, .portStatus = KERN_NO_ACCESS});
    kernel.addTask({.pid = 123, .name = "foo"});
    const auto process = TLProcess::processWithPid(123);
    ASSERT_TRUE(process);
    EXPECT_EQ(process->displayString(), "foo [123]");
    EXPECT_TRUE(process->is64bit());
    TLProcess other;
    other.setPid(123);
    EXPECT_TRUE(other == *process && other.hash() == process->hash());
    testing::internal::CaptureStderr();
    for (const std::int32_t pid : {5, 6}) {
        EXPECT_FALSE(TLProcess::processWithPid(pid)) << pid;
    }
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "task_read_for_pid: "s + mach_error_string(KERN_NO_ACCESS) + "\n");
}

TEST(AuxData, SumsWhatMayBeSummed) {
    using Dictionary = TLAuxDictionary;
    const auto leaf = [](std::int64_t value, bool sums = true) { return TLAuxDatum(TLAuxData(value, sums)); };
    const auto nested = [](Dictionary dictionary) { return TLAuxDatum(std::move(dictionary)); };
    const Dictionary five{{{"a", leaf(5)}}};
    const Dictionary own{{{"a", leaf(7, false)}}}; // may not be summed
    const Dictionary tree{{{"m", nested({{{"x", leaf(1)}, {"z", leaf(1, false)}}})}}};
    const Dictionary branch{{{"m", nested({{{"x", leaf(2)}, {"y", leaf(3)}}})}}};
    EXPECT_EQ(five.mergeWithData(std::nullopt), five);
    EXPECT_EQ(five.mergeWithData(own), (Dictionary{{{"a", leaf(12)}}})) << "the second's flag is not asked";
    EXPECT_EQ(own.mergeWithData(five), std::nullopt);
    EXPECT_EQ(Dictionary().mergeWithData(own), std::nullopt);
    EXPECT_EQ(tree.mergeWithData(branch), (Dictionary{{{"m", nested({{{"x", leaf(3)}, {"y", leaf(3)}}})}}}));
    EXPECT_DEATH(five.mergeWithData(Dictionary{{{"a", nested({})}}}),
                 "!datum2 .. datum1.isContainer == datum2.isContainer.*mergeAuxDatum.*TLAuxData");
}

} // namespace
} // namespace tally
