#include "output/PrintedReport.h"
#include "report/TLTime.h"

namespace tally {
namespace {

using TextReportTest = AnalysisTest;

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

TEST_F(TextReportTest, AuxiliaryDataIsATree) {
    const TLAuxDictionary aux{
        {{"own\a", TLAuxData(1048576, false)}, {"sums", TLAuxDictionary{{{"k\x80", TLAuxData(1, true)}}}}}};
    EXPECT_EQ(
        printed([&](std::FILE* file) {
            TLOutputFormatterText(TLSummaryFormat::formatted, 0, "Dirty", file).printProcessAuxData(aux);
        }),
        "Auxiliary data:\n\town?: 1024 KB\n\tsums:\n\t\tk?: 1 B\n\n");
}

} // namespace
} // namespace tally
