// Snapshots of real processes: their reports against those of the processes.

#include "linux/Puppet.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <regex>
#include <sstream>

namespace tally::test {
namespace {

namespace fs = std::filesystem;

/// The figures of a bytes report: for each section and category the bytes, without the count of regions.
using Rows = std::map<std::string, std::string>;

Rows rowsOf(const std::string& report) {
    static const std::regex row(R"(^ *((?:\d+ B +)+)\d+    (.*)$)");
    std::istringstream lines(report);
    Rows rows;
    std::string section;
    for (std::string line; std::getline(lines, line);) {
        std::smatch parts;
        if (std::regex_match(line, parts, row)) {
            rows[section + ": " + parts[2].str()] = std::regex_replace(parts[1].str(), std::regex(" +"), " ");
        } else if (line.find(" [") != std::string::npos || line.find("Summary") == 0) {
            section =
                std::regex_replace(line.substr(0, line.find("\t")), std::regex(" \\(heapsnap\\)|:.*"), "");
        }
    }
    return rows;
}

class Snapshot : public testing::Test {
  protected:
    std::string path(const std::string& name) const { return folder_.path() + "/" + name; }

    void take(const Puppet& puppet, const std::string& name, const std::string& view = "--") {
        std::vector<std::string> command{HEAPSNAP_PROGRAM, "-o", path(name), view,
                                         std::to_string(puppet.pid())};
        if (view == "--") {
            command.erase(command.begin() + 3);
        }
        const Outcome outcome = run(command);
        ASSERT_EQ(outcome.status, 0) << outcome.errors;
        if (!test::isKernelBefore(6, 5)) { // there the page cache cannot be asked, which is said
            EXPECT_EQ(outcome.errors, "");
        }
    }

    static Outcome tally(std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {TALLY_PROGRAM, "-f", "bytes", "-w", "-v"});
        return run(arguments);
    }

    TemporaryFolder folder_;
};

TEST_F(Snapshot, ReportsWhatTheProcessReports) {
    const Puppet zoo({"zoo"});
    const Puppet big({"big", "64"});
    const Puppet* const puppets[] = {&zoo, &big};
    for (const std::string view : {"--swapped", "--vmObjectDirty"}) { // the first changes nothing here
        if (view == "--vmObjectDirty" && !isRoot()) {
            GTEST_SKIP() << "the page cache is asked for root only";
        }
        for (const Puppet* puppet : puppets) {
            const std::string pid = std::to_string(puppet->pid());
            const auto figuresOf = [&](const std::string& target) {
                const Outcome outcome = tally({view, target == pid ? "--pid" : "--", target});
                EXPECT_EQ(outcome.errors, "");
                std::string text;
                for (const auto& [row, figures] : rowsOf(outcome.output)) {
                    // A snapshot has no page tables, which only the first view shows.
                    const bool mayDiffer = row.ends_with(": page table") || row.ends_with(": TOTAL");
                    text += mayDiffer && view == "--swapped" ? "" : row + " " + figures + "\n";
                }
                EXPECT_GT(text.size(), 500U);
                return text;
            };
            expectSameReport([&] { return figuresOf(pid); },
                             [&] {
                                 take(*puppet, pid, view == "--swapped" ? "--" : view);
                                 return figuresOf(path(pid));
                             });
        }
    }
}

TEST_F(Snapshot, SharesWithProcessesAndSnapshotsInWhateverOrder) {
    const std::string file = "/dev/shm/tally-test-snapshot-" + std::to_string(getpid());
    std::ofstream(file) << std::string(64 * 4096, 'x');
    const Puppet writer({"fill", file, "40"}); // pages 0 to 39
    const Puppet reader({"share", file});      // all 64
    take(writer, "writer");
    take(reader, "reader");
    const std::string w = std::to_string(writer.pid());
    const std::string r = std::to_string(reader.pid());
    const auto figures = [&](const std::vector<std::string>& targets) {
        Rows rows = rowsOf(tally(targets).output);
        std::erase_if(rows, [&](const auto& row) { // what nothing stands behind is a region of its own there
            return row.first.find("mapped file " + file) == std::string::npos ||
                   row.second == "0 B 0 B 0 B 0 B 0 B ";
        });
        return rows;
    };
    const Rows live = figures({"--pid", w, "--pid", r});
    EXPECT_EQ(live.size(), 3U) << "one with each, one in the summary";
    EXPECT_EQ(figures({path("writer"), path("reader")}), live);
    EXPECT_EQ(figures({path("reader"), path("writer")}), live);
    EXPECT_EQ(figures({path("reader"), "--pid", w}), live);
    EXPECT_EQ(figures({path("writer"), "--pid", r}), live);
    fs::remove(file);
}

} // namespace
} // namespace tally::test
