// The figures of all processes together against the machine's own counters.
//
// What other programs do meanwhile moves both, so the suite runs alone, compares what is added, and tries
// again for a minute.

#include "linux/Puppet.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>

namespace tally::test {
namespace {

/// Bytes of a row of /proc/meminfo, with the processors' own counters folded in first.
std::int64_t meminfo(const std::string& key) {
    std::ofstream("/proc/sys/vm/stat_refresh") << "1";
    std::ifstream file("/proc/meminfo");
    for (std::string word; file >> word;) {
        std::int64_t kibibytes = 0;
        if (word == key + ":" && file >> kibibytes) {
            return kibibytes * 1024;
        }
    }
    return -1;
}

/// Dirty bytes per category of the summary over all processes.
std::map<std::string, std::int64_t> summary(const std::string& view) {
    const Outcome outcome = run({TALLY_PROGRAM, "-a", "-x", "kernel", "-f", "bytes", view});
    std::istringstream lines(
        outcome.output.substr(std::min(outcome.output.rfind("Summary Tally"), outcome.output.size())));
    std::map<std::string, std::int64_t> rows;
    for (std::string line; std::getline(lines, line);) {
        // "dirty B  clean B  reclaimable B  regions    category"
        std::istringstream figures(line);
        std::int64_t dirty = 0;
        std::string skipped;
        std::string category;
        if (figures >> dirty >> skipped && skipped == "B") {
            for (int field = 0; field < (view == "--swapped" ? 7 : 5); ++field) {
                figures >> skipped;
            }
            std::getline(figures >> std::ws, category);
            rows[category] += dirty;
        }
    }
    return rows;
}

struct Machine {
    std::int64_t anonymous = 0;
    std::int64_t shared = 0;
    std::int64_t pageTables = 0;

    static Machine byMeminfo() { return {meminfo("AnonPages"), meminfo("Shmem"), meminfo("PageTables")}; }
    static Machine byTally() {
        Machine machine;
        for (const auto& [category, dirty] : summary("--swapped")) {
            machine.pageTables += category == "page table" ? dirty : 0;
            machine.anonymous += category == "TOTAL" ? dirty : 0;
        }
        machine.anonymous -= machine.pageTables;
        for (const auto& [category, dirty] : summary("--vmObjectDirty")) {
            machine.shared += category.starts_with("shared memory") ? dirty : 0;
        }
        return machine;
    }
    Machine operator-(const Machine& other) const {
        return {anonymous - other.anonymous, shared - other.shared, pageTables - other.pageTables};
    }
};

bool isWithin(std::int64_t measured, std::int64_t expected, double part) {
    const double allowed = std::max(static_cast<double>(expected) * part, 1048576.0);
    return std::abs(static_cast<double>(measured - expected)) <= allowed;
}

/// What puppets added, by the machine's counters and by the tool.
struct Attempt {
    Machine expected;
    Machine measured;
    bool wasQuiet = false; // everything was as before once the puppets had ended
};

Attempt addPuppets() {
    Attempt attempt;
    const Machine before = Machine::byMeminfo();
    const Machine tallyBefore = Machine::byTally();
    {
        // Anonymous memory: forked relatives and one alone. What of it is shared counts once in both.
        const Puppet same({"family", "8", "16384", "same"});
        const Puppet half({"family", "4", "16384", "half"});
        const Puppet big({"big", "128"});
        const Machine middle = Machine::byMeminfo();
        const Machine tallyMiddle = Machine::byTally();
        // Shared memory, of which one process touches a part only: the object view counts all of it.
        const Puppet writer({"memory", "24576"});
        attempt.expected = middle - before;
        attempt.measured = tallyMiddle - tallyBefore;
        attempt.expected.shared = (Machine::byMeminfo() - middle).shared;
        attempt.measured.shared = (Machine::byTally() - tallyMiddle).shared;
    }
    constexpr std::int64_t quiet = 512 << 10;
    const Machine left = Machine::byMeminfo() - before;
    const Machine tallyLeft = Machine::byTally() - tallyBefore;
    attempt.wasQuiet = true;
    for (const std::int64_t difference : {left.anonymous, left.shared, left.pageTables, tallyLeft.anonymous,
                                          tallyLeft.shared, tallyLeft.pageTables}) {
        attempt.wasQuiet = attempt.wasQuiet && std::abs(difference) <= quiet;
    }
    return attempt;
}

TEST(Machine, WhatSeveralTouchOfAnObjectCountsOnce) {
    const SwapFile swap(64); // without it the same is seen of what is in memory
    const TemporaryFolder folder;
    for (const char* seed : {"1", "2"}) {
        const Outcome outcome =
            run({"/usr/bin/python3", UNIONS, TALLY_PROGRAM, PUPPET_PROGRAM, folder.path(), seed});
        if (outcome.status == 77) {
            GTEST_SKIP() << "the page cache cannot be asked here";
        }
        EXPECT_EQ(outcome.status, 0) << outcome.errors;
        EXPECT_NE(outcome.output.find("memory:"), std::string::npos) << outcome.output;
    }
}

/// Pages of relatives and of shared memory, swapped out before the fork, count once, as the swap file has
/// them.
TEST(Machine, SwappedMemoryOfRelativesIsWhatTheSwapFileHolds) {
    const SwapFile swap(64);
    if (!swap.isOn()) {
        GTEST_SKIP() << "no swap file can be had here";
    }
    const auto used = [] { return meminfo("SwapTotal") - meminfo("SwapFree"); };
    const std::int64_t before = used();
    const Puppet family({"family", "3", "4096", "swapped"});
    std::vector<std::string> command{TALLY_PROGRAM, "-f",    "bytes",
                                     "--swapped",   "--pid", std::to_string(family.pid())};
    for (const Puppet::Entry& entry : family.ledger()) {
        if (entry.name == "child") {
            command.insert(command.end(), {"--pid", std::to_string(entry.size)});
        }
    }
    const std::string report = run(command).output;
    std::int64_t swapped = 0;
    std::istringstream summaryRows(report.substr(std::min(report.rfind("Summary Tally"), report.size())));
    for (std::string line; std::getline(summaryRows, line);) {
        std::string unit;
        std::int64_t dirty = 0;
        std::int64_t figure = 0;
        if (std::istringstream(line) >> dirty >> unit >> figure && line.ends_with("TOTAL")) {
            swapped = figure;
        }
    }
    const std::int64_t expected = used() - before;
    EXPECT_GT(expected, 30 << 20);
    EXPECT_TRUE(isWithin(swapped, expected, 0.005)) << swapped << " of " << expected;
}

constexpr const char* mergingSwitch = "/sys/kernel/mm/ksm/run";

/// Has the kernel merge pages of one content, and what it merged taken apart again in the end.
class PageMerging {
  public:
    PageMerging() : lock_(lockOfMachine("merging")) {
        int before = -1;
        std::ifstream(mergingSwitch) >> before;
        isOn_ = before == 0 && static_cast<bool>(std::ofstream(mergingSwitch) << 1 << std::flush);
    }
    ~PageMerging() {
        for (const char* step : {"2", "0"}) {
            if (isOn_) {
                std::ofstream(mergingSwitch) << step;
            }
        }
        close(lock_);
    }
    bool isOn() const { return isOn_; }

  private:
    int lock_ = -1;
    bool isOn_ = false;
};

TEST(Machine, PagesMergedByContentAreAWarningOfTheirProcess) {
    constexpr std::size_t size = 64 << 10;
    void* const memory = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    std::memset(memory, 7, size);
    const PageMerging merging;
    int merged = 0;
    if (merging.isOn() && madvise(memory, size, MADV_MERGEABLE) == 0) {
        for (int i = 0; i < 100 && merged == 0; ++i) {
            usleep(50'000);
            std::ifstream("/proc/self/ksm_merging_pages") >> merged;
        }
    }
    const std::string own = std::to_string(getpid());
    const std::string report = run({TALLY_PROGRAM, "--pid", own}).output;
    munmap(memory, size);
    if (merged == 0) {
        GTEST_SKIP() << "the kernel merges no pages here, or others have it do so";
    }
    EXPECT_NE(report.find("(KSM) count for every process"), std::string::npos) << report;
}

TEST(Machine, WhatProcessesAddIsWhatTheMachineCounts) {
    if (!isRoot()) {
        GTEST_SKIP() << "all processes are measured by root only";
    }
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(1);
    while (std::chrono::steady_clock::now() < deadline) {
        const auto [expected, measured, wasQuiet] = addPuppets();
        const bool agrees = isWithin(measured.anonymous, expected.anonymous, 0.001) &&
                            isWithin(measured.shared, expected.shared, 0.005) &&
                            isWithin(measured.pageTables, expected.pageTables, 0.03);
        if (agrees || wasQuiet) {
            EXPECT_TRUE(agrees) << "anonymous " << measured.anonymous << " of " << expected.anonymous
                                << ", shared " << measured.shared << " of " << expected.shared
                                << ", page tables " << measured.pageTables << " of " << expected.pageTables;
            return;
        }
    }
    GTEST_SKIP() << "other programs change the machine's memory too much to compare";
}

} // namespace
} // namespace tally::test
