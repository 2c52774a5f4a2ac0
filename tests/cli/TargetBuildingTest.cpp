#include "cli/TargetBuilding.h"
#include "cli/CommandLine.h"
#include "cli/ParseArguments.h"
#include "platform/quarry.h"
#include "platform/scripted/ScriptedKernel.h"
#include "process/TLCorpseProcess.h"

#include <algorithm>
#include <filesystem>
#include <fstream>

namespace tally {
namespace {

using namespace platform;

/// The crash information of a corpse of process 100.
std::vector<std::byte> crashInformation() {
    constexpr std::uint32_t words[] = {0xDEADF157, 0, 0, 0, 0x805, 4, 0, 0, 100, 0xF19158ED, 0, 0, 0};
    const auto bytes = std::as_bytes(std::span(words));
    return {bytes.begin(), bytes.end()};
}

/// init 1 has the children server 100 and idle 105; server has the workers 101 and 102 and tally itself;
/// worker 101 has helper 103 and guarded 104, which cannot be read. idle is idle-exit clean.
class TargetBuilding : public testing::Test {
  protected:
    TargetBuilding() {
        kernel.addTask({.pid = 0, .parent = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM});
        kernel.addTask({.pid = 1, .parent = 0, .name = "init"});
        kernel.addTask({.pid = 100, .name = "server", .crashInformation = crashInformation()});
        kernel.addTask({.pid = 101, .parent = 100, .name = "worker"}); // without crash information
        kernel.addTask({.pid = 102, .parent = 100, .name = "worker", .corpseStatus = KERN_FAILURE});
        kernel.addTask({.pid = 103, .parent = 101, .name = "helper"});
        kernel.addTask({.pid = 104, .parent = 101, .name = "guar\tded", .portStatus = KERN_NO_ACCESS});
        kernel.findTask(104)->usage.ri_resident_anonymous = 4096;
        kernel.addTask({.pid = 105, .name = "idle", .dirtyFlags = 3});
        kernel.addTask({.pid = kernel.ownPid, .parent = 100, .name = "tally"});
    }

    struct Built {
        std::string targets = "none"; // pids, hidden ones in brackets, corpses with a "c"
        std::string messages;         // on standard error, without the reason of a refused port
        TLError error{.message = {}};
    };

    static Built build(const std::string& words) {
        CommandLine line(words);
        Built built;
        built.messages = written([&] {
                             auto args = std::get<TLTallyArgs>(parseArguments(line.argc(), line.argv()));
                             std::optional<TLError> error;
                             if (const auto table = targetProcessesForArgs(args, &error)) {
                                 built.targets = describe(*table);
                             }
                             built.error = error.value_or(built.error);
                         }).second;
        if (built.messages.starts_with("task_read_for_pid")) {
            built.messages.erase(0, built.messages.find('\n') + 1);
        }
        return built;
    }

    static std::string describe(const TLProcessTable& table) {
        std::string text;
        for (const auto& [key, process] : table) {
            const bool isCorpse = dynamic_cast<TLCorpseProcess*>(process.get()) != nullptr;
            const std::string name = std::to_string(key) + (isCorpse ? "c" : "");
            text += (text.empty() ? "" : " ") + (process->hiddenFromDisplay() ? "[" + name + "]" : name);
        }
        return text;
    }

    ScriptedKernel kernel;
};

TEST_F(TargetBuilding, FollowsTheOptions) {
    const std::string refused = "Unable to analyze process guar?ded [104] (try as root?)\n";
    const std::string refusedPid = "Unable to analyze process with pid 104 (try as root?)\n";
    const std::string noPid = "Unable to analyze process with pid -5 (try as root?)\n";
    const std::string unread =
        "NOTICE: processes that could not be read and are left out: 1 (with 4096 bytes of "
        "resident anonymous memory)\n";
    const std::string noCorpse = std::string("Unable to fork a corpse of process worker [102]: ") +
                                 mach_error_string(KERN_FAILURE) + "\n";
    const std::string unknown = "Unable to find pid for process matching ";
    const struct {
        std::string words, targets, messages, unresolved;
    } cases[] = {
        {"worker", "101 102", "", ""},
        {"worker server --pid 103 105x", "100 101 102 103 105", "", ""},
        {"worker no\nbody Server", "101 102", "", unknown + "'Server'\n" + unknown + "'no?body'"},
        {"tally nobody", "", "", unknown + "'nobody'"}, // tally itself is no target
        {"worker -x worker -x nobody -p server", "100", "", ""},
        {"-x 102 worker", "101", "", ""},
        {"guar\tded helper", "103", refused, ""},
        {"--pid 104", "", refusedPid, ""},
        {"--pid -5 100", "100", noPid, ""},
        {"-t worker guar\tded", "101 102 103", refusedPid, ""},                   // names are forgotten
        {"-t server -x worker -x idle", "100 101 102 103 99000", refusedPid, ""}, // descendants come back
        {"-s idle server", "100", "", ""},
        {"-a -x worker server", "0 1 100 103 105", unread, ""},
        {"--unmapped worker -x server", "[1] 101 102 [103] [105]", unread, ""},
        {"--forkCorpse server worker", "100c", noCorpse, ""},
    };
    for (const auto& [words, targets, messages, unresolved] : cases) {
        const Built built = build(words);
        EXPECT_EQ(built.targets, targets) << words;
        EXPECT_EQ(built.messages, messages) << words;
        EXPECT_EQ(built.error.message, unresolved) << words;
        EXPECT_EQ(built.error.code, unresolved.empty() ? 0 : TLErrorBadPid);
    }
    EXPECT_EQ(kernel.heldPortReferences(), 0U); // the builder's right to a corpse included
}

} // namespace
} // namespace tally
