// How shared memory is told: whole reports with the layout taken off.

#include "output/PrintedReport.h"

#include <algorithm>
#include <sstream>

namespace tally {
namespace {

using SharingReportTest = AnalysisTest;

/// A line per process, sharing line and row; rows show pages dirty, clean, reclaimable, and regions. Checks
/// that rows add up to their total.
std::string told(const TLTally::ProcessList& processes, int formatters = 1) {
    std::istringstream report(reportText(processes, TLSummaryFormat::pages, 0, "Category", formatters));
    std::string lines = "\n";
    std::array<int, 4> sum{};
    for (std::string line; std::getline(report, line);) {
        std::array<int, 4> row{};
        char name[16] = "";
        if (std::sscanf(line.c_str(), "%d pages %d pages %d pages %d %15s", &row[0], &row[1], &row[2],
                        &row[3], name) != 5) {
            const bool isLayout = line.empty() || line[0] == '=' || line[0] == ' ';
            lines += isLayout ? "" : line.substr(0, line.find(" (4096")) + "\n";
        } else if (std::string(name) == "TOTAL") {
            EXPECT_EQ(std::exchange(sum, {}), row) << lines;
        } else {
            lines += formatted("%d %d %d x%d %s\n", row[0], row[1], row[2], row[3], name);
            std::ranges::transform(sum, row, sum.begin(), std::plus());
        }
    }
    return lines;
}

TEST_F(SharingReportTest, EveryExactSetHasASectionAsTheProcessSeesIt) {
    const RegionRecord heap = {.object = 1, .size = 3, .dirty = 3};
    const RegionRecord all = {.name = "all", .object = 2, .size = 4, .clean = 4};
    RegionRecord two = {.name = "two", .object = 3, .size = 4, .dirty = 2};
    two.share_mode = platform::SM_SHARED;
    RegionRecord otherPart = two;
    otherPart.offset = 4;
    otherPart.dirty = 1;
    const auto first = ready(5, {all, heap});
    first->_addGlobalError("interrupted"); // enough to spoil the summary
    EXPECT_EQ(told({first, ready(6, {two, all}), ready(7, {all, otherPart})}), R"(
p [5]: 64-bit	Tally: 3 pages
3 0 0 x1 heap
Shared with p [6], p [7]:
0 4 0 x3 all
p [6]: 64-bit	Tally: 2 pages
Shared with p [5], p [7]:
0 4 0 x3 all
Shared with p [7]:
2 0 0 x1 two
p [7]: 64-bit	Tally: 1 pages
Shared with p [5], p [6]:
0 4 0 x3 all
Shared with p [6]:
1 0 0 x1 two
Errors were encountered:
	interrupted
Due to errors, summary results may be invalid
Summary Tally: 6 pages (may be invalid due to errors)
0 4 0 x3 all
3 0 0 x1 heap
3 0 0 x2 two
)");
    // Every formatter has a step before the next step begins.
    const std::string header = "p [5]: 64-bit\tTally: 3 pages\n";
    EXPECT_EQ(told({ready(5, {heap})}, 2), "\n" + header + header + "3 0 0 x1 heap\n3 0 0 x1 heap\n");
}

TEST_F(SharingReportTest, TheOwnerPaysForWhatAnotherMaps) {
    const RegionRecord heap = {.object = 3, .size = 1, .clean = 1};
    const RegionRecord plain = {.name = "plain", .object = 2, .size = 1, .dirty = 1};
    const RegionRecord mapped = {.name = "file", .object = 1, .size = 4, .dirty = 3, .swapped = 1};
    RegionRecord ownedMapped = plain;
    RegionRecord ownedUnmapped = mapped;
    ownedMapped.owned = ownedUnmapped.owned = ownedUnmapped.unmapped = true;
    ownedUnmapped.name = "owned";
    const auto owner = ready(5, {ownedUnmapped, ownedMapped});
    const auto mapper = ready(6, {heap, mapped, plain});
    const TLTally::ProcessList processes = {owner, mapper, ready(9, {})};
    // Equal totals: the larger pid first. The mapped region names the object. What it costs is clean to the
    // one who does not pay.
    EXPECT_EQ(told(processes), R"(
p [6]: 64-bit	Tally: 5 pages
0 1 0 x1 heap
Shared with p [5]:
0 4 0 x2 file
0 1 0 x2 plain
p [5]: 64-bit	Tally: 5 pages
Shared with p [6]:
4 0 0 x2 file
1 0 0 x2 plain
p [9]: 64-bit	Tally: 0 pages
Summary Tally: 5 pages
4 0 0 x2 file
0 1 0 x1 heap
1 0 0 x2 plain
)");
    // A hidden process is named only as the mapper of unmapped memory of a displayed one, and never summed.
    mapper->setHiddenFromDisplay(true);
    EXPECT_EQ(told(processes), R"(
p [5]: 64-bit	Tally: 5 pages
1 0 0 x2 plain
Shared with p [6]:
4 0 0 x2 file
p [9]: 64-bit	Tally: 0 pages
Summary Tally: 5 pages
4 0 0 x2 file
1 0 0 x2 plain
)");
    setPhysTallyCollectionEnabled(0); // nobody owns anything
    EXPECT_EQ(told(processes), R"(
p [5]: 64-bit	Tally: 5 pages
4 0 0 x2 file
1 0 0 x2 plain
p [9]: 64-bit	Tally: 0 pages
VM Object Dirty Analysis: Enabled
Summary Tally: 5 pages
4 0 0 x2 file
1 0 0 x2 plain
)");
    setPhysTallyCollectionEnabled(1);
    mapper->setHiddenFromDisplay(false);
    owner->setHiddenFromDisplay(true); // and is not named where it owns
    EXPECT_TRUE(told(processes).starts_with(R"(
p [6]: 64-bit	Tally: 5 pages
0 4 0 x2 file
0 1 0 x1 heap
0 1 0 x2 plain
)"));
}

} // namespace
} // namespace tally
