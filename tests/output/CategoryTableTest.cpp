#include "output/CategoryTable.h"
#include "output/PrintedReport.h"

namespace tally {
namespace {

TEST(ValueFormat, ShowsByteCounts) {
    struct {
        std::int64_t bytes;
        const char *asBytes, *asFormatted, *asPages; // of 16384 bytes
    } const cases[] = {
        {0, "0 B", "0 B", "0 pages"},
        {1, "1 B", "1 B", "1 pages"},
        {9999, "9999 B", "9999 B", "1 pages"}, // four digits fit
        {10000, "10000 B", "10 KB", "1 pages"},
        {16385, "16385 B", "16 KB", "2 pages"},
        {1048576, "1048576 B", "1024 KB", "64 pages"},
        {10239487, "10239487 B", "9999 KB", "625 pages"}, // half a KB less a byte is dropped
        {10239488, "10239488 B", "10 MB", "625 pages"},   // 10000 KB no longer fit
        {-1000, "-1000 B", "-1 KB", "0 pages"},           // three digits beside the sign
    };
    for (const auto& [bytes, asBytes, asFormatted, asPages] : cases) {
        EXPECT_EQ((ValueFormat{TLSummaryFormat::bytes}.formatValue(bytes)), asBytes);
        EXPECT_EQ((ValueFormat{TLSummaryFormat::formatted}.formatValue(bytes)), asFormatted);
        EXPECT_EQ((ValueFormat{TLSummaryFormat::pages, 0, 16384}.formatValue(bytes)), asPages);
        EXPECT_EQ((ValueFormat{TLSummaryFormat::pages}.formatValue(bytes)), "0 pages"); // no process yet
    }
}

TEST(ValueFormat, ShortensPaths) {
    std::string shown;
    for (const char* path : {"/usr/lib/x.so", "/x", "lib/x", "x.so", "/lib/", "/a b/c (deleted)", "/", ""}) {
        shown += ValueFormat().shortenPath(path) + "|";
        EXPECT_EQ((ValueFormat{TLSummaryFormat::bytes, TLTextOptionWide}.shortenPath(path)), path);
    }
    EXPECT_EQ(shown, ".../x.so|.../x|.../x|x.so|.../lib|.../c (deleted)|/||");
}

TEST(CategoryTable, PutsTheLargestFirstAndEqualRowsInTheOrderOfKeys) {
    TLCategoryDictionary categories;
    // B, a and d have ten dirty bytes: the more reclaimable one comes first, then the cleaner one.
    categories["a"].totals = {{4, 6, 2, 5, 0}, 1};
    categories["B"].totals = {{10, 0, 2, 7, 0}, 2};
    categories["c"].totals = {{20, 0, 1, 0, 1}, 1};
    categories["d"].totals = {{10, 0, 3, 5, 0}, 3};
    categories["e"].totals = {{9, 0, 9, 1, 0}, 0};
    // A row's letter each, in the order of columns; a capital is before the small letters.
    const std::string expected[] = {"cBdae", "aBcde", "edBac", "Badec", "cBade", "dBace", "Bacde"};
    const auto sorts = TLOutputFormatterText::textSortColumns();
    ASSERT_EQ(sorts.size(), std::size(expected));
    for (std::size_t i = 0; i < sorts.size(); ++i) {
        const std::string text = printed([&](std::FILE* file) {
            printCategoryTable(file, {TLSummaryFormat::bytes}, categories, sorts[i], false);
        });
        std::string letters;
        for (std::size_t end = text.find('\n'); end != text.npos; end = text.find('\n', end + 1)) {
            letters += text[end - 1];
        }
        EXPECT_EQ(letters.substr(2), expected[i]) << sorts[i]; // after the titles and the dashes
    }
    EXPECT_DEATH(printCategoryTable(stdout, {}, categories, "dirty", false), "Unhandled text sort column");
}

} // namespace
} // namespace tally
