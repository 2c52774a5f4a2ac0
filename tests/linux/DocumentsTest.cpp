// The documents of real runs: that they are valid and say what the text says, however a run ends.

#include "linux/Puppet.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>
#include <sys/mman.h>
#include <unistd.h>

#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>
#include <thread>

namespace tally::test {
namespace {

using Words = std::vector<std::string>;

std::string pidOf(const Puppet& puppet) { return std::to_string(puppet.pid()); }

/// A run with all three outputs in its folder.
Words commandWith(const Words& more) {
    Words command{TALLY_PROGRAM, "-f", "bytes", "-w", "-v", "-j", "x.json", "--benchlog", "x.blj"};
    command.insert(command.end(), more.begin(), more.end());
    return command;
}

std::string contentsOf(const std::string& path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

/// Compares every figure of the three outputs in `folder`. @return how many reports there are.
int expectAgreementIn(const std::string& folder) {
    const Outcome outcome = run({"/usr/bin/python3", AGREEMENT, folder});
    EXPECT_EQ(outcome.status, 0) << outcome.errors;
    return std::atoi(outcome.output.c_str());
}

/// Checks JSON files against the schema of the documentation.
void expectValid(const Words& paths) {
    Words command{"/usr/bin/python3", "-m", "jsonschema"};
    for (const std::string& path : paths) {
        command.insert(command.end(), {"-i", path});
    }
    command.emplace_back(JSON_SCHEMA);
    const Outcome outcome = run(command);
    EXPECT_EQ(outcome.status, 0) << outcome.output << outcome.errors;
}

bool holds(const std::string& text, const std::string& part) { return text.find(part) != text.npos; }

TEST(Documents, SayWhatTheTextSays) {
    const Puppet zoo({"zoo"});
    const Puppet family({"family", "22", "200", "half"}); // more sharers than the text names
    const std::string shared = "/dev/shm/tally-test-documents-" + std::to_string(getpid());
    { std::ofstream(shared) << std::string(64 * 4096, 'x'); }
    const Puppet writer({"fill", shared, "40"});
    const Puppet reader({"share", shared});
    std::filesystem::remove(shared);
    const TemporaryFolder folder;
    for (const Words& more :
         {Words{"-t", "--pid", pidOf(zoo), "--pid", pidOf(family), "--pid", pidOf(writer), "--pid",
                pidOf(reader)},
          Words{"--vmObjectDirty", "--pid", pidOf(zoo), "--pid", pidOf(writer), "--pid", pidOf(reader)},
          Words{"--pid", pidOf(reader)}}) {
        EXPECT_EQ(Background(commandWith(more), folder.path()).wait(), 0)
            << contentsOf(folder.path() + "/err");
        EXPECT_EQ(expectAgreementIn(folder.path()), 1);
        expectValid({folder.path() + "/x.json"});
    }
}

TEST(Documents, GoWhereverAPathLeads) {
    const Puppet puppet({"idle"});
    const TemporaryFolder folder;
    const auto shell = [&](const std::string& before, const std::string& after) {
        return run({"/bin/sh", "-c", before + " " TALLY_PROGRAM " --pid " + pidOf(puppet) + " " + after},
                   folder.path());
    };
    using nlohmann::json;
    const Outcome piped = shell("", "-j /dev/stdout | tail -n 1"); // after the text, in one line
    EXPECT_TRUE(json::accept(piped.output)) << piped.output;
    shell("", "-j out >out"); // both to one file
    EXPECT_TRUE(json::accept(
        contentsOf(folder.path() + "/out").substr(contentsOf(folder.path() + "/out").rfind('\n'))));
    const Outcome fifo = shell("mkfifo f; (sleep 0.2; cat f) & exec", "-j f >/dev/null");
    EXPECT_TRUE(json::accept(fifo.output)) << fifo.output;
    EXPECT_EQ(shell("", "-j closed.json >&- 2>&-").status, 0);
    EXPECT_TRUE(json::accept(contentsOf(folder.path() + "/closed.json")));

    const std::string other = folder.path() + "/f2"; // another name of a file that is mapped and untouched
    std::filesystem::create_hard_link(folder.path() + "/closed.json", other);
    const auto size = std::filesystem::file_size(other);
    mmap(nullptr, size, PROT_READ, MAP_SHARED, open(other.c_str(), O_RDONLY), 0);
    EXPECT_EQ(shell("", "--pid $PPID -j closed.json").status, 1);
    EXPECT_EQ(std::filesystem::file_size(other), size);
    if (access(TALLY_PROGRAM, W_OK) != 0) {
        GTEST_SKIP() << "this user may not write to the program";
    }
    const Outcome busy = run({TALLY_PROGRAM, "--pid", pidOf(puppet), "-j", TALLY_PROGRAM});
    EXPECT_EQ(busy.status, 1);
    EXPECT_EQ(busy.errors, "Unable to open JSON writer: Text file busy\nUnable to create JSON output\n");
}

/// Waits until `run` in `folder` has printed `count` samples more; throws when it ends before.
void awaitSamples(const Background& run, const std::string& folder, std::size_t count) {
    const auto printed = [&] {
        const std::string text = contentsOf(folder + "/out");
        std::size_t found = 0;
        for (std::size_t at = 0; (at = text.find("Time: ", at)) != text.npos; ++at) {
            ++found;
        }
        return found;
    };
    for (const std::size_t before = printed(); printed() < before + count;) {
        if (run.hasEnded()) {
            throw std::runtime_error("the run has ended: " + contentsOf(folder + "/err"));
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
}

TEST(Documents, AFullDiskIsSaidAndLeavesWholeLines) {
    const Puppet puppet({"maps", "3000"});
    const TemporaryFolder folder;
    const auto onSmallDisk = [&](const std::string& words) {
        return Words{"/usr/bin/unshare",
                     "-m",
                     "/bin/sh",
                     "-c",
                     "mount -t tmpfs -o size=64k none /mnt && cd /mnt && exec " TALLY_PROGRAM " --pid $0 " +
                         words,
                     pidOf(puppet)};
    };
    const auto incomplete = [&](const std::string& file) {
        return holds(contentsOf(folder.path() + "/err"),
                     "Unable to write all of " + file + ", which is incomplete: No space left on device\n");
    };
    if (run({"/usr/bin/unshare", "-m", "mount", "-t", "tmpfs", "none", "/mnt"}).status != 0) {
        GTEST_SKIP() << "no file system can be mounted here";
    }
    EXPECT_EQ(Background(onSmallDisk("-v -j x.json"), folder.path()).wait(), 1);
    EXPECT_TRUE(incomplete("x.json"));

    Background sampling(onSmallDisk("--sample 0.02 --benchlog x.blj"), folder.path());
    awaitSamples(sampling, folder.path(), 2);
    const std::string disk = "/proc/" + std::to_string(sampling.pid()) + "/cwd/";
    { std::ofstream(disk + "rest") << std::string(65536, 'x'); }
    awaitSamples(sampling, folder.path(), 10);
    const std::string lines = contentsOf(disk + "x.blj");
    EXPECT_TRUE(lines.ends_with("}\n")) << lines;
    kill(sampling.pid(), SIGINT);
    EXPECT_EQ(sampling.wait(), 1);
    EXPECT_TRUE(incomplete("x.blj"));
}

/// Samples a puppet that grows, shrinks, forks and, at last, ends.
void followAPuppet(std::chrono::seconds time) {
    auto puppet = std::make_unique<Puppet>(Words{"breathe"});
    const TemporaryFolder folder;
    Background sampling(commandWith({"--sample", "0.1", "-t", "--pid", pidOf(*puppet)}), folder.path());
    const auto anonymous = [&] {
        std::ifstream status("/proc/" + std::to_string(sampling.pid()) + "/status");
        for (std::string line; std::getline(status, line);) {
            if (line.starts_with("RssAnon:")) {
                return std::stol(line.substr(8));
            }
        }
        return -1L;
    };
    awaitSamples(sampling, folder.path(), 10);
    [[maybe_unused]] const long early = anonymous();
    std::this_thread::sleep_for(time);
    [[maybe_unused]] const long late = anonymous();
    puppet.reset();
    awaitSamples(sampling, folder.path(), 8); // its children last a little longer
    kill(sampling.pid(), SIGINT);
    EXPECT_EQ(sampling.wait(), 0);
    const std::string errors = contentsOf(folder.path() + "/err");
    EXPECT_TRUE(holds(errors, "\nStopping...\n")); // a sample that is under way may still miss a target
    EXPECT_TRUE(errors.ends_with("Analyzing and writing output...\n"));

    EXPECT_GE(expectAgreementIn(folder.path()), 18);
    expectValid({folder.path() + "/x.json"});
    std::int64_t end = 0;
    std::set<std::int64_t> totals;
    std::set<std::size_t> sizes;
    const auto document = nlohmann::json::parse(contentsOf(folder.path() + "/x.json"));
    for (const auto& sample : document["samples"]) {
        const std::int64_t start = sample["start_time"]["mach_absolute_time_ns"];
        EXPECT_GT(start, end);
        end = sample["end_time"]["mach_absolute_time_ns"];
        EXPECT_GE(end, start);
        totals.insert(sample["total tally"].get<std::int64_t>());
        sizes.insert(sample["processes"].size());
    }
    EXPECT_GE(totals.size(), 10U); // it was followed, not remembered
    EXPECT_GT(sizes.size(), 1U);
    EXPECT_EQ(document["samples"].back()["total tally"], 0); // nothing is left, but for zombies
#ifndef __SANITIZE_ADDRESS__
    EXPECT_LE(late - early, 1024) << "KiB";
#endif
}

TEST(Documents, FollowAProcessThatChanges) { followAPuppet(std::chrono::seconds(3)); }
TEST(LongDocuments, FollowAProcessForAMinute) { followAPuppet(std::chrono::seconds(60)); }

/// Interrupts runs at random moments: what exits with 0 has left whole documents, and no run that has begun
/// to listen is killed.
void interruptRuns(int runs) {
    const Puppet family({"family", "8", "4000", "random"});
    const TemporaryFolder folder;
    Words once{"-t", "--pid", pidOf(family)};
    Words sampled{"--sample", "0.05", "-t", "--pid", pidOf(family)};
    const auto begin = std::chrono::steady_clock::now();
    ASSERT_EQ(Background(commandWith(once), folder.path()).wait(), 0);
    const auto length = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();

    std::mt19937 random(static_cast<unsigned>(getpid()));
    std::uniform_real_distribution<double> part(0, 1);
    std::vector<std::string> valid;
    std::map<std::string, int> endings;
    std::string earlier = contentsOf(folder.path() + "/x.json");
    for (int i = 0; i < runs; ++i) {
        const bool isSampled = i % 2 == 0;
        const int signal = i % 3 == 0 ? SIGTERM : SIGINT;
        const double moment = part(random) * (isSampled ? 3 : 1.3) * length;
        SCOPED_TRACE((isSampled ? "sampling" : "one report") + std::string(" ended by signal ") +
                     std::to_string(signal) + " after " + std::to_string(moment) + " s");
        Background tally(commandWith(isSampled ? sampled : once), folder.path());
        std::this_thread::sleep_for(std::chrono::duration<double>(moment));
        kill(tally.pid(), signal);
        const int status = tally.wait();
        const std::string errors = contentsOf(folder.path() + "/err");
        const bool hasListened = holds(errors, isSampled ? "Sampling at" : "Exiting early");
        ++endings[std::string(isSampled ? "sampling " : "once ") + (hasListened ? "heard " : "") +
                  std::to_string(status)];
        const std::string document = contentsOf(folder.path() + "/x.json");
        if (status == 0 && holds(errors, "No sample was completed")) {
            EXPECT_EQ(document, earlier);
        } else if (status == 0) {
            expectAgreementIn(folder.path());
            valid.push_back(folder.path() + "/" + std::to_string(i) + ".json");
            std::filesystem::copy(folder.path() + "/x.json", valid.back());
            earlier = document;
        } else {
            EXPECT_FALSE(hasListened) << errors;
            EXPECT_EQ(status, 128 + signal) << errors;
        }
    }
    ASSERT_FALSE(valid.empty());
    expectValid(valid);
    for (const auto& [ending, count] : endings) {
        std::printf("%s: %d\n", ending.c_str(), count);
    }
}

TEST(Documents, SurviveInterrupts) { interruptRuns(20); }
TEST(LongDocuments, SurviveManyInterrupts) { interruptRuns(200); }

TEST(Documents, AreWholeWhicheverSignalEndsSampling) {
    const Puppet puppet({"idle"});
    const TemporaryFolder folder;
    const auto sampling = [&](const std::string& before) {
        return Words{"/bin/sh", "-c", before + "exec " TALLY_PROGRAM " --sample 0.05 -j x.json --pid $0",
                     pidOf(puppet)};
    };
    for (const int signal : {SIGINT, SIGTERM, SIGHUP, 0}) {
        Background tally(sampling(signal == 0 ? "trap '' HUP; " : ""), folder.path());
        awaitSamples(tally, folder.path(), 1);
        if (signal == 0) { // a hang-up that was ignored from the start ends nothing
            kill(tally.pid(), SIGHUP);
            awaitSamples(tally, folder.path(), 3);
        }
        kill(tally.pid(), signal == 0 ? SIGINT : signal);
        EXPECT_EQ(tally.wait(), 0) << signal;
        const auto document = nlohmann::json::parse(contentsOf(folder.path() + "/x.json"), nullptr, false);
        EXPECT_TRUE(document.is_object()) << signal;
    }
}

TEST(Documents, AreCompletedWhenNobodyReadsTheText) {
    const Puppet puppet({"idle"});
    const TemporaryFolder folder;
    const auto statusOf = [&](const std::string& words, const std::string& rest) {
        run({"/bin/sh", "-c",
             "{ " TALLY_PROGRAM " --sample 0.02 " + words +
                 " --pid $0 & echo $! >pid; wait $!; echo $? >status; } | head -n 1 & " + rest + "wait",
             pidOf(puppet)},
            folder.path());
        return contentsOf(folder.path() + "/status");
    };
    EXPECT_EQ(statusOf("", ""), "141\n"); // a text alone ends
    EXPECT_EQ(
        statusOf("-j x.json",
                 "until [ 0$(stat -c %s x.json) -gt 20000 ]; do sleep 0.1; done; kill -INT $(cat pid); "),
        "0\n");
    EXPECT_TRUE(nlohmann::json::accept(contentsOf(folder.path() + "/x.json")));

    const Puppet many({"maps", "3000"}); // more text than a pipe holds
    for (const char* signal : {"INT", "TERM", "HUP"}) {
        run({"/bin/sh", "-c",
             "rm -f status x.json pid; { " TALLY_PROGRAM
             " -v -j x.json --pid $0 & echo $! >pid; wait $!; echo $? >status; } | "
             "{ read line; until [ -s pid ]; do sleep 0.1; done; kill -$1 $(cat pid); until [ -s status ]; "
             "do sleep 0.1; done; }",
             pidOf(many), signal},
            folder.path());
        EXPECT_EQ(contentsOf(folder.path() + "/status"), "0\n") << signal;
        EXPECT_TRUE(nlohmann::json::accept(contentsOf(folder.path() + "/x.json"))) << signal;
    }
}

} // namespace
} // namespace tally::test
