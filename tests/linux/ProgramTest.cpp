// The tool itself on real processes: its report, its messages, and how it ends.

#include "linux/Puppet.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace tally::test {
namespace {

std::string pidOf(const Puppet& puppet) { return std::to_string(puppet.pid()); }

Outcome tallyOf(std::vector<std::string> arguments, const std::string& folder = "") {
    arguments.insert(arguments.begin(), TALLY_PROGRAM);
    return run(arguments, folder);
}

bool holds(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

/// The first number of the line of a bytes report that ends in `category`, behind the place where `after`
/// stands.
std::int64_t bytesOf(const std::string& report, const std::string& after, const std::string& category) {
    std::istringstream lines(report.substr(std::min(report.find(after), report.size())));
    for (std::string line; std::getline(lines, line);) {
        if (line.ends_with("    " + category)) {
            return std::stoll(line);
        }
    }
    return -1;
}

TEST(Program, KernelsWithoutTheNewQueriesGiveTheSameReport) {
    const Puppet puppet({"zoo"});
    const Puppet many({"maps", "15000"});
    for (const char* view : {"-w", "--vmObjectDirty"}) {
        const std::vector<std::string> command{TALLY_PROGRAM, "-v",          "-f",    "bytes",    view,
                                               "--pid",       pidOf(puppet), "--pid", pidOf(many)};
        const Outcome plain = run(command);
        ASSERT_EQ(plain.status, 0) << plain.errors;
        for (const char* request :
             {"0xc0686611", "0xc0606610"}) { // the query for a mapping, the scan of pages
            std::vector<std::string> refused{PUPPET_PROGRAM, "refuse", request};
            refused.insert(refused.end(), command.begin(), command.end());
            const Outcome older = run(refused);
            EXPECT_EQ(older.status, 0);
            EXPECT_EQ(older.errors, plain.errors);
            EXPECT_EQ(older.output, plain.output) << request;
        }
    }
}

TEST(Program, AProcessIsChargedWhatTheKernelSays) {
    const Puppet puppet({"big", "32"});
    const Outcome outcome = tallyOf({"-f", "bytes", "--pid", pidOf(puppet)});
    std::ifstream status("/proc/" + pidOf(puppet) + "/status");
    std::int64_t expected = 4096; // the top-level page table, which VmPTE leaves out
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with("RssAnon:") || line.starts_with("RssShmem:") || line.starts_with("VmPTE:")) {
            expected += std::stoll(line.substr(line.find(':') + 1)) * 1024;
        }
    }
    EXPECT_TRUE(
        holds(outcome.output, "64-bit\tTally: " + std::to_string(expected) + " B (4096 bytes per page)\n"))
        << outcome.output;
    EXPECT_EQ(bytesOf(outcome.output, "Tally:", "TOTAL"), expected);
}

TEST(Program, SaysWhatItCannotFindAndGoesOnWithTheRest) {
    Puppet puppet({"idle"});
    const Outcome one = tallyOf({"-p", "no-such-name", "-p", pidOf(puppet)});
    EXPECT_EQ(one.status, 0);
    EXPECT_EQ(one.errors, "Unable to find pid for process matching 'no-such-name'\n");
    const Outcome none = tallyOf({"-p", "no-such-name"});
    EXPECT_EQ(none.status, 1);
    EXPECT_EQ(none.errors,
              "Unable to find any processes matching the supplied process names or pids (try as root?)\n");
    const Outcome gone = tallyOf({"--pid", "1073741823"});
    EXPECT_EQ(gone.status, 1);
    EXPECT_TRUE(holds(gone.errors, "Unable to analyze process with pid 1073741823 (try as root?)\n"));
    const Outcome corpse = tallyOf({"--forkCorpse", "--pid", pidOf(puppet)});
    EXPECT_EQ(corpse.status, 1);
    EXPECT_TRUE(
        corpse.errors.starts_with("Unable to fork a corpse of process puppet [" + pidOf(puppet) + "]: "));

    puppet.end(true);
    const Outcome zombie = tallyOf({"--pid", pidOf(puppet)});
    EXPECT_EQ(zombie.status, 0);
    EXPECT_TRUE(holds(zombie.output, "Warnings were encountered while examining the process.\n"))
        << zombie.output;
    EXPECT_TRUE(holds(zombie.output, " (zombie)\n"));
}

TEST(Program, AnotherUsersProcessIsRefusedOneByOne) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "only root can become another user";
    }
    const Puppet puppet({"idle"});
    const TemporaryFolder folder;
    const std::string program = folder.path() + "/tally"; // where every user can reach it
    std::filesystem::copy_file(TALLY_PROGRAM, program);
    chmod(folder.path().c_str(), 0755);
    const auto asUser = [&](std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(),
                         {"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", program});
        return run(arguments);
    };
    const Outcome refused = asUser({"--pid", pidOf(puppet)});
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(
        holds(refused.errors, "Unable to analyze process with pid " + pidOf(puppet) + " (try as root?)\n"))
        << refused.errors;
    const Outcome all = asUser({"-a", "-j", folder.path() + "/x.json"});
    EXPECT_EQ(all.status, 1);
    EXPECT_EQ(all.errors, "Must run as root.\n");
    EXPECT_FALSE(std::filesystem::exists(folder.path() + "/x.json"));
}

TEST(Program, ControlBytesOfNamesDoNotReachTheTerminal) {
    const TemporaryFolder folder;
    const std::string path = folder.path() + "/a\n\x1b[2J b\xc2\x9b\xff (deleted) \xc3\xa9";
    {
        std::ofstream file(path);
        const std::string bytes(8192, 'x');
        file << bytes;
    }
    const Puppet puppet({"share", path});
    for (const char* request : {"0", "0xc0686611"}) {
        const Outcome outcome =
            run({PUPPET_PROGRAM, "refuse", request, TALLY_PROGRAM, "-v", "-w", "--pid", pidOf(puppet)});
        EXPECT_TRUE(holds(outcome.output, folder.path() + "/a??[2J b?\xff (deleted) \xc3\xa9\n"));
        EXPECT_FALSE(holds(outcome.output, "\x1b"));
    }
}

TEST(Program, ClosedStreamsAndAClosedPipeEndNothing) {
    const Puppet puppet({"idle"});
    const std::string command = std::string(TALLY_PROGRAM) + " --pid " + pidOf(puppet);
    EXPECT_EQ(run({"/bin/sh", "-c", "exec " + command + " <&- >&- 2>&-"}).status, 0);
    const TemporaryFolder folder;
    // With output closed no file of the run may become the output.
    EXPECT_EQ(run({"/bin/sh", "-c", command + " -j " + folder.path() + "/no/x.json >&- 2>err"}, folder.path())
                  .status,
              1);
    EXPECT_EQ(run({"/bin/sh", "-c", "{ " + command + " -v; echo $? >&2; } | true"}).errors, "0\n");
    EXPECT_EQ(run({"/bin/sh", "-c", command + " >/dev/full"}).status, 0);
}

TEST(Program, ProcessesThatComeAndGoDisturbNothing) {
    // A shell that starts and ends children all the time while everything is measured.
    const Puppet churn({"churn"});
    const TemporaryFolder folder;
    const Outcome storm =
        run({"/bin/sh", "-c",
             "(i=0; while [ $i -lt 400 ]; do /bin/true; i=$((i+1)); done) & "
             "for n in 1 2 3 4 5; do " TALLY_PROGRAM " -a -f bytes >out 2>>err || exit 9; done; wait; "
             "grep -c TOTAL out"},
            folder.path());
    if (geteuid() != 0) {
        GTEST_SKIP() << "all processes are measured by root only";
    }
    EXPECT_EQ(storm.status, 0) << storm.errors;
}

} // namespace
} // namespace tally::test
