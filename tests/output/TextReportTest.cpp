// Whole reports. The figures follow from the regions that a case writes down; pages are of 4096 bytes. Every
// kind of name carries a control character, and none may reach the terminal.

#include "output/PrintedReport.h"
#include "report/TLTime.h"

namespace tally {
namespace {

using TextReportTest = AnalysisTest;

// 200 + 56 pages are 1024 KB, 3 pages 12 KB, 20 pages 80 KB; up to 9999 a value is not scaled. The reserved
// row is hidden and counts in the total. Only figures without errors that may be summed are summed.
TEST_F(TextReportTest, TwoProcessesThatShareAFileOneWithProblems) {
    const RegionRecord library = {
        .name = "lib\x1bx", .detail = "/usr/lib/caf\xc3\xa9\xff\x7f", .object = 2, .size = 40, .clean = 20};
    const auto alpha =
        ready(5,
              {{.object = 1, .size = 300, .dirty = 200, .swapped = 56, .clean = 3, .reclaimable = 1},
               {.name = "reserved", .object = 3, .size = 7, .clean = 7, .verbose = true},
               library},
              "al\npha");
    const auto beta = ready(6, {library}, "be\tta");
    alpha->aux = beta->aux = {
        {{{"own\a", TLAuxData(1048576, false)}, {"sums", TLAuxDictionary{{{"k\x80", TLAuxData(1, true)}}}}}}};
    alpha->addWarning("watch\rout");
    alpha->_addGlobalError("cut\bshort");
    beta->addError("un\fable");
    EXPECT_EQ(reportText({beta, alpha}, TLSummaryFormat::formatted, 0, "Dirty"),
              R"(======================================================================
al?pha [5]: 64-bit
Warnings were encountered while examining the process.
	watch?out
	Tally: 1024 KB (4096 bytes per page)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
1024 KB      12 KB       4096 B          1    heap
    ---        ---          ---        ---    ---
1024 KB      40 KB       4096 B          2    TOTAL

Shared with be?ta [6]:
  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
    0 B      80 KB          0 B          2    lib?x .../café??
    ---        ---          ---        ---    ---
    0 B      80 KB          0 B          2    TOTAL

Auxiliary data:
	own?: 1024 KB
	sums:
		k?: 1 B

======================================================================
be?ta [6]: 64-bit
Errors were encountered while examining the process. No results gathered.
	un?able
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
    ---        ---          ---        ---    ---
    0 B        0 B          0 B          0    TOTAL

Auxiliary data:
	own?: 1024 KB
	sums:
		k?: 1 B


Warnings were encountered while examining the following processes:
	al?pha

Errors were encountered while examining the following processes:
	be?ta

Errors were encountered:
	cut?short

Due to errors, summary results may be invalid
======================================================================
Summary Tally: 1024 KB (may be invalid due to errors)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
1024 KB      12 KB       4096 B          1    heap
    0 B      80 KB          0 B          2    lib?x .../café??
    ---        ---          ---        ---    ---
1024 KB     120 KB       4096 B          4    TOTAL

Auxiliary data:
	sums:
		k?: 1 B

)");
}

// Processes are counted anew in every report. Pages are those of the process shown last, here of 16384 bytes:
// 9 * 4096 are 2.25 of them.
TEST_F(TextReportTest, OneReportAfterTheOther) {
    const TLTime time(1, 2, 800000000.25);
    ReadyProcess process(5, {}, "p");
    process.setPageSize(16384);
    process.setIsTranslated(true);
    const std::string text = printed([&](std::FILE* file) {
        TLOutputFormatterText formatter(TLSummaryFormat::pages, TLTextOptionWired, "Wired", file);
        formatter.startAtTime(time); // silent: there could be one report only
        formatter.configureForMultipleOutputs();
        formatter.startAtTime(time);
        formatter.printProcessHeader(process);
        formatter.printSummaryCategories({}, {}, false);
        formatter.printGlobalAuxData(TLAuxDictionary());
        formatter.startAtTime(std::nullopt); // a clock that cannot be read
        formatter.printSummaryCategories({}, {{.dirty = 5 * page, .swapped = 4 * page, .wired = 1}, 0},
                                         false);
        formatter.printGlobalAuxData(std::nullopt);
    });
    const std::string separator(80, '=');
    EXPECT_TRUE(text.starts_with("Time: " + platform::iso8601LocalDate(*TLTime::date(time)) + "\n" +
                                 separator + "\np [5]: 64-bit (translated)" + separator +
                                 "\nSummary Tally: 3 pages\n"));
    EXPECT_TRUE(text.ends_with(R"(
      Dirty         Clean   Reclaimable       (Wired)    Regions    Category
        ---           ---           ---           ---        ---    ---
        ---           ---           ---           ---        ---    ---
    3 pages       0 pages       0 pages       1 pages          0    TOTAL

)")) << text;
}

} // namespace
} // namespace tally
