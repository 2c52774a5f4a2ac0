// The tool itself on real processes: its report, its messages, and how it ends.

#include "linux/Puppet.h"

#include <gtest/gtest.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace tally::test {
namespace {

std::string pidOf(const Puppet& puppet) { return std::to_string(puppet.pid()); }

bool holds(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

/// Older kernels answer a request that they do not know by ENOTTY, filters of containers by EPERM or ENOSYS.
TEST(Program, KernelsWithoutTheNewQueriesGiveTheSameReport) {
    const Puppet puppet({"zoo"});
    const Puppet many({"maps", "15000"});
    for (const char* view : {"-w", "--vmObjectDirty"}) {
        const std::vector<std::string> command{TALLY_PROGRAM, "-v",          "-f",    "bytes",    view,
                                               "--pid",       pidOf(puppet), "--pid", pidOf(many)};
        const auto reportOf = [](const std::vector<std::string>& words) {
            const Outcome outcome = run(words);
            EXPECT_EQ(outcome.status, 0);
            return outcome.errors + outcome.output;
        };
        for (const std::string& request : // the query for a mapping, the scan of pages
             {std::string("0xc0686611:25"), std::string("0xc0606610:25"), std::string("0xc0686611:1"),
              std::string("0xc0606610:38"), std::to_string(SYS_statx), std::to_string(SYS_kcmp)}) {
            SCOPED_TRACE(request);
            std::vector<std::string> refused{PUPPET_PROGRAM, "refuse", request};
            refused.insert(refused.end(), command.begin(), command.end());
            expectSameReport([&] { return reportOf(command); }, [&] { return reportOf(refused); });
        }
    }
}

TEST(Program, AProcessIsChargedWhatTheKernelSays) {
    const Puppet puppet({"big", "32"});
    const Outcome outcome = run({TALLY_PROGRAM, "-f", "bytes", "--pid", pidOf(puppet)});
    // By page tables: before 6.2 the counters lag. What VmPTE leaves out is the top-level table.
    std::stringstream status;
    status << std::ifstream("/proc/" + pidOf(puppet) + "/smaps_rollup").rdbuf()
           << std::ifstream("/proc/" + pidOf(puppet) + "/status").rdbuf();
    std::int64_t expected = 4096;
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with("Anonymous:") || line.starts_with("RssShmem:") || line.starts_with("VmPTE:")) {
            expected += std::stoll(line.substr(line.find(':') + 1)) * 1024;
        }
    }
    EXPECT_TRUE(
        holds(outcome.output, "64-bit\tTally: " + std::to_string(expected) + " B (4096 bytes per page)\n"))
        << outcome.output;
    const std::string total = outcome.output.substr(0, outcome.output.find("    TOTAL\n"));
    EXPECT_EQ(std::stoll(total.substr(total.rfind('\n'))), expected) << "the row adds up to the header";
}

TEST(Program, AnotherUsersProcessIsRefusedOneByOne) {
    if (!isRoot()) {
        GTEST_SKIP() << "only root can become another user";
    }
    const Puppet puppet({"idle"});
    const TemporaryFolder folder;
    const std::string program = folder.path() + "/tally"; // where every user can reach it
    std::filesystem::copy_file(TALLY_PROGRAM, program);
    chmod(folder.path().c_str(), 0755);
    const Outcome refused = run({"/usr/bin/setpriv", "--reuid=65534", "--regid=65534", "--clear-groups",
                                 program, "--pid", pidOf(puppet)});
    EXPECT_EQ(refused.status, 1);
    EXPECT_TRUE(
        holds(refused.errors, "Unable to analyze process with pid " + pidOf(puppet) + " (try as root?)\n"))
        << refused.errors;
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
        EXPECT_TRUE(holds(outcome.output, folder.path() + "/a??[2J b?? (deleted) \xc3\xa9\n"));
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
    const Outcome few = run({"/bin/sh", "-c", "ulimit -Sn 8; ulimit -Hn 8; exec " + command});
    // Who may raise the limit has it raised.
    EXPECT_EQ(few.errors.starts_with("Too few file descriptors are allowed: 8, "), few.status == 1)
        << few.errors;
}

TEST(Program, SaysWhatItCouldNotWrite) {
    const Puppet puppet({"maps", "300"});
    const TemporaryFolder folder;
    const std::string command = std::string(TALLY_PROGRAM) + " -v --pid " + pidOf(puppet);
    const std::string text = "Unable to write all of the report to standard output: ";
    const std::pair<std::string, std::string> cases[] = {
        {command + " >/dev/full", text + "No space left on device\n"},
        {TALLY_PROGRAM " -h >/dev/full", "Unable to write to standard output: No space left on device\n"},
        {"ulimit -f 1; " + command + " >out", text + "File too large\n"},
        {"ulimit -f 1; " + command + " -j x.json >/dev/null",
         "Unable to write all of x.json, which is incomplete: File too large\n"},
        {"ulimit -f 1; " HEAPSNAP_PROGRAM " -o x.heapsnap " + pidOf(puppet),
         "Unable to write x.heapsnap: File too large\n"},
    };
    for (const auto& [line, errors] : cases) {
        const Outcome outcome = run({"/bin/sh", "-c", line}, folder.path());
        EXPECT_EQ(outcome.status, 1) << line;
        EXPECT_EQ(outcome.errors, errors);
    }
}

TEST(Program, WhatMayNotBeLookedAtIsAWarning) {
    const Puppet puppet({"idle"});
    const Outcome outcome = run({PUPPET_PROGRAM, "refuse", std::to_string(SYS_readlinkat) + ":13",
                                 TALLY_PROGRAM, "--pid", pidOf(puppet)});
    const std::string warning = "Descriptors could not be looked at (Permission denied): "
                                "memory that only they keep is left out\n";
    const std::size_t at = outcome.output.find(warning);
    EXPECT_NE(at, std::string::npos) << outcome.output;
    EXPECT_EQ(outcome.output.find(warning, at + 1), std::string::npos) << "once";
}

TEST(Program, OnlyTheMarkOfADeletedExecutableIsTakenOffItsName) {
    const TemporaryFolder folder;
    for (const std::string& name : {std::string("alive-7 (deleted)"), std::string("gone-7")}) {
        const std::string path = folder.path() + "/" + name;
        std::filesystem::copy_file(PUPPET_PROGRAM, path);
        const Puppet puppet({"idle"}, path);
        if (name == "gone-7") {
            std::filesystem::remove(path);
        }
        for (const char* way : {"-w", "--forkCorpse"}) {
            const Outcome outcome = run({TALLY_PROGRAM, way, "-p", name});
            EXPECT_TRUE(holds(outcome.output, "\n" + name + " [" + pidOf(puppet) + "]")) << outcome.errors;
        }
        // The process that asks files is a descendant of the tool, and no target.
        const std::string own =
            run({TALLY_PROGRAM, "-t", "-p", name, "--pid", std::to_string(getpid())}).output;
        EXPECT_EQ(own.find("\ntally ["), own.rfind("\ntally [")) << own;
    }
}

TEST(Program, AProgramInAnotherRootIsKnownToAnOrdinaryUser) {
    const TemporaryFolder folder;
    std::filesystem::copy_file(TALLY_PROGRAM, folder.path() + "/tally");
    chmod(folder.path().c_str(), 0755);
    const Outcome outcome =
        run({"/bin/sh", "-c",
             "cd $0 && for file in /bin/sleep $(ldd /bin/sleep | grep -o '/[^ ]*'); do "
             "mkdir -p root${file%/*} && cp $file root$file || exit 77; done; "
             "chroot --userspec=65534:65534 root /bin/sleep 60 & pid=$!; trap 'kill $pid' EXIT; "
             "for i in 1 2 3 4 5 6 7 8 9; do readlink /proc/$pid/exe | grep -q root/bin && break; sleep 0.1; "
             "done; "
             "setpriv --reuid=65534 --regid=65534 --clear-groups ./tally --pid $pid",
             folder.path()});
    if (!isRoot() || outcome.status == 77) {
        GTEST_SKIP() << "needs root, and a program to copy";
    }
    EXPECT_TRUE(holds(outcome.output, "__LINKEDIT\n")) << outcome.output << outcome.errors;
}

/// A program that is mapped from a mount of which nobody answers.
TEST(Program, AFileSystemThatDoesNotAnswerHoldsUpNothing) {
    const std::string server = "/usr/bin/bindfs";
    if (geteuid() != 0 || !std::filesystem::exists(server) || access("/dev/fuse", R_OK | W_OK) != 0) {
        GTEST_SKIP() << "needs root, /dev/fuse and bindfs";
    }
    const TemporaryFolder folder;
    const std::string mount = folder.path() + "/mount";
    std::filesystem::create_directories(folder.path() + "/source");
    std::filesystem::create_directories(mount);
    std::filesystem::copy_file(PUPPET_PROGRAM, folder.path() + "/source/program");
    const Background bindfs({server, "-f", folder.path() + "/source", mount}, folder.path());
    for (int i = 0; i < 500 && !std::filesystem::exists(mount + "/program"); ++i) {
        usleep(10'000);
    }
    if (!std::filesystem::exists(mount + "/program")) {
        GTEST_SKIP() << "nothing can be mounted here";
    }
    {
        const Puppet puppet({"idle"}, mount + "/program");
        const Puppet other({"idle"});
        kill(bindfs.pid(), SIGSTOP);
        const std::string file = folder.path() + "/snapshot";
        const std::vector<std::string> ways[] = {{TALLY_PROGRAM, "-p", "program"},
                                                 {TALLY_PROGRAM, "--forkCorpse", "-p", "program"},
                                                 {TALLY_PROGRAM, "--vmObjectDirty", "-p", "program"},
                                                 {HEAPSNAP_PROGRAM, "-o", file, pidOf(puppet)},
                                                 {TALLY_PROGRAM, "--pid", pidOf(other)}};
        for (const std::vector<std::string>& way : ways) {
            std::vector<std::string> command{"/usr/bin/timeout", "-s", "KILL", "60"};
            command.insert(command.end(), way.begin(), way.end());
            const Outcome outcome = run(command);
            EXPECT_EQ(outcome.status, 0) << way[1] << outcome.errors;
            EXPECT_EQ(holds(outcome.output + outcome.errors, "it does not answer"), way[1] != "--pid")
                << way[1];
        }
        kill(bindfs.pid(), SIGCONT);
    }
    umount2(mount.c_str(), MNT_DETACH);
}

TEST(Program, ProcessesThatComeAndGoDisturbNothing) {
    Puppet ended({"idle"});
    ended.end(true); // its parent has not taken leave of it yet
    const Puppet live({"idle"});
    const Outcome both = run({TALLY_PROGRAM, "--pid", pidOf(ended), "--pid", pidOf(live)});
    EXPECT_EQ(both.status, 0) << both.errors;

    // A shell that starts and ends children all the time while everything is measured.
    const Puppet churn({"churn"});
    const TemporaryFolder folder;
    const Outcome storm = run({"/bin/sh", "-c",
                               "(i=0; while [ $i -lt 400 ]; do /bin/true; i=$((i+1)); done) & "
                               "for n in 1 2 3 4 5; do " TALLY_PROGRAM
                               " -a -f bytes >out 2>err || { cat err >&2; exit 9; }; done; "
                               "wait; grep -c TOTAL out"},
                              folder.path());
    if (geteuid() != 0) {
        GTEST_SKIP() << "all processes are measured by root only";
    }
    EXPECT_EQ(storm.status, 0) << storm.errors;
}

} // namespace
} // namespace tally::test
