#include "analysis/ReadyProcess.h"
#include "output/TLOutputFormatterJSON.h"

#include <nlohmann/json.hpp>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace tally {
namespace {

using json = nlohmann::json;

struct Options {
    bool listing = false;
    int samples = 0; // 0: one report
};

class JSONReport : public AnalysisTest {
  protected:
    JSONReport() {
        setenv("TZ", "CET-1", 1);
        tzset();
    }
    ~JSONReport() override {
        unsetenv("TZ");
        tzset();
        std::filesystem::remove(path);
    }

    /// The document on `processes`, as it stands in the file.
    std::string document(const TLTally::ProcessList& processes, Options options = {}) {
        const auto formatter = TLOutputFormatterJSON::create(path);
        if (options.samples != 0) {
            formatter->configureForMultipleOutputs();
        }
        for (int i = 0; i < std::max(options.samples, 1); ++i) {
            TLTally tally(processes);
            tally.addOutputFormatter(formatter);
            tally.analyzeMemoryObjects();
            tally.printReport(options.listing, true);
        }
        EXPECT_EQ(formatter->close(), 0);
        return fileText();
    }

    std::string fileText() const {
        std::ostringstream text;
        text << std::ifstream(path).rdbuf();
        return text.str();
    }

    const std::string path = testing::TempDir() + "tally-report-" + std::to_string(getpid()) + ".json";
};

// Of a report that was not gathered.
const char* const noTime =
    R"({"mach_absolute_time_ns":0,"mach_continuous_time_ns":0,"wall_time_s":0.000000,"date":null})";

TEST_F(JSONReport, WritesEveryKeyInItsOrder) {
    const auto process =
        ready(7, {{.name = "heap", .object = 0x10, .size = 4, .dirty = 2, .swapped = 1, .clean = 1},
                  {.name = "file",
                   .detail = "/a",
                   .object = 0x20,
                   .size = 3,
                   .clean = 2,
                   .reclaimable = 1,
                   .offset = 5,
                   .start = 0x30,
                   .wired = true},
                  {.name = "page table", .object = TLNotSet, .size = 1, .dirty = 1, .unmapped = true},
                  {.name = "rest", .size = 9, .start = 0x40}});
    process->aux = TLAuxDictionary{
        {{"own", TLAuxData(-5, false)}, {"sum", TLAuxDictionary{{{"peak", TLAuxData(6, true)}}}}}};
    process->addWarning("no \"rights\"");
    const char* const categories =
        R"("file":{"dirty":0,"swapped":0,"clean":8192,"reclaimable":4096,"wired":12288,"regions":1},)"
        R"("heap":{"dirty":12288,"swapped":4096,"clean":4096,"reclaimable":0,"wired":0,"regions":1},)"
        R"("page table":{"dirty":4096,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":1},)"
        R"("rest":{"dirty":0,"swapped":0,"clean":0,"reclaimable":0,"wired":0,"regions":1})";
    EXPECT_EQ(
        document({process}, {.listing = true}),
        std::string(R"({"unit":"byte","bytes per unit":1,"start_time":)") + noTime +
            R"(,"processes":[{"name":"p","pid":7,"translated":false,"page size":4096,)"
            R"("warnings":["no \"rights\""],"regions":[)"
            R"({"id":16,"name":"heap","addr":65536,"vsize":16384,"dirty":8192,"swapped":4096,"clean":4096},)"
            R"({"id":32,"name":"file /a","addr":196608,"vsize":12288,"offset":20480,"clean":8192,)"
            R"("reclaimable":4096,"wired":12288},)"
            R"({"id":18446744073709551615,"name":"page table","vsize":4096,"dirty":4096},)"
            R"({"id":0,"name":"rest","addr":262144,"vsize":36864}],)"
            R"("tally":16384,"categories":{)" +
            categories +
            R"(},"auxiliary":{"own":-5,"sum":{"peak":6}}}],"errors":[],"warnings":["p [7]: no \"rights\""],"summary":{)" +
            categories +
            R"(,"total":{"dirty":16384,"swapped":4096,"clean":12288,"reclaimable":4096,"wired":12288,"regions":4}},)"
            R"("total tally":16384,"auxiliary":{"sum":{"peak":6}},"shared":[],"end_time":)" +
            noTime + R"(,"page size":4096})");
}

TEST_F(JSONReport, OfNothingAndInTheOtherViewIsComplete) {
    setPhysTallyCollectionEnabled(0);
    kernel.pageSize = 16384;
    EXPECT_EQ(
        document({}),
        std::string(R"({"unit":"byte","bytes per unit":1,"vm_object_dirty_analysis":true,"start_time":)") +
            noTime +
            R"(,"processes":[],"errors":[],"warnings":[],"summary":{"total":{"dirty":0,"swapped":0,"clean":0,)"
            R"("reclaimable":0,"wired":0,"regions":0}},"total tally":0,"auxiliary":null,"shared":[],"end_time":)" +
            noTime + R"(,"page size":16384})");
}

TEST_F(JSONReport, SamplesStandBesideEachOther) {
    const auto process = ready(7, {{.object = 1, .size = 1, .dirty = 1}});
    process->setPageSize(16384);
    const std::string text = document({process}, {.samples = 3});
    const auto parsed = nlohmann::ordered_json::parse(text);
    ASSERT_EQ(parsed.at("samples").size(), 3U);
    EXPECT_EQ((++parsed.rbegin()).key(), "samples");
    EXPECT_EQ(parsed.rbegin().key(), "page size");
    EXPECT_EQ(parsed.at("page size"), 16384);
    for (const auto& sample : parsed["samples"]) {
        EXPECT_EQ(sample.size(), 9U);
    }
    EXPECT_TRUE(text.ends_with(R"(}}],"page size":16384})"));
    EXPECT_EQ(json::parse(document({}, {.samples = 1}))["samples"].size(), 1U);
}

TEST_F(JSONReport, TellsTheTimesOnAllClocks) {
    const auto formatter = TLOutputFormatterJSON::create(path);
    const TLTime time(24, 48, 721692800.345);
    formatter->startAtTime(time);
    formatter->printProcessesWithWarnings({}, {}, {});
    formatter->endAtTime(std::nullopt);
    formatter->close();
    const std::string expected = formatted(
        R"("start_time":{"mach_absolute_time_ns":%llu,"mach_continuous_time_ns":%llu,"wall_time_s":721692800.345000,)"
        R"("date":"2023-11-14T23:13:20.345+01:00"})",
        static_cast<unsigned long long>(TLTime::absoluteTimeNs(time)),
        static_cast<unsigned long long>(TLTime::continuousTimeNs(time)));
    EXPECT_NE(fileText().find(expected), std::string::npos) << fileText();
}

TEST_F(JSONReport, RecordsAGroupOnceAndEachViewOfItsOwn) {
    // Object 1 looks the same to both; of object 2 each sees a part.
    const RegionRecord same{
        .name = "same", .object = 1, .size = 1, .dirty = 1, .share_mode = platform::SM_SHARED};
    const RegionRecord few{
        .name = "parts", .object = 2, .size = 4, .clean = 1, .share_mode = platform::SM_SHARED};
    const RegionRecord more{
        .name = "parts", .object = 2, .size = 4, .clean = 3, .share_mode = platform::SM_SHARED};
    const json common = json::parse(document({ready(1, {same}), ready(2, {same})}));
    ASSERT_EQ(common["shared"].size(), 1U);
    EXPECT_EQ(common["shared"][0]["pids"], (json{1, 2}));
    EXPECT_FALSE(common["shared"][0].contains("specific_to_pid"));
    EXPECT_EQ(common["shared"][0]["categories"]["same"]["dirty"], page);
    for (const json& process : common["processes"]) {
        EXPECT_FALSE(process.contains("categories")); // all of its memory is shared
    }
    const json views = json::parse(document({ready(1, {few}), ready(2, {more})}));
    ASSERT_EQ(views["shared"].size(), 2U);
    for (const json& view : views["shared"]) {
        const bool isFew = view["specific_to_pid"] == 1;
        EXPECT_EQ(view["categories"]["parts"]["clean"], (isFew ? 1 : 3) * page);
    }
    // A report begins with no groups: the second sample records the group again.
    const json samples = json::parse(document({ready(1, {same}), ready(2, {same})}, {.samples = 2}));
    EXPECT_EQ(samples["samples"][1]["shared"].size(), 1U);
}

TEST_F(JSONReport, NoKeyIsThereTwice) {
    // Names that read the same, and one that the summary has itself.
    std::vector<RegionRecord> regions;
    for (const char* name : {"a\xfe", "a\xff", "a\ufffd (2)", "total"}) {
        regions.push_back(
            {.name = name, .object = regions.size() + 1, .size = 9, .dirty = 1 + regions.size()});
    }
    const json names = json::parse(document({ready(1, regions)}))["summary"];
    const std::pair<const char*, int> rows[] = {
        {"a\ufffd (2)", 3}, {"a\ufffd", 1}, {"a\ufffd (3)", 2}, {"total (2)", 4}, {"total", 10}};
    EXPECT_EQ(names.size(), std::size(rows)) << names;
    for (const auto& [key, pages] : rows) {
        EXPECT_EQ(names[key]["dirty"], pages * page) << key;
    }
    // Process 1 calls the second object "y", so that is its row's name for process 2 as well.
    const auto part = [](const char* name, std::uint64_t object, std::uint64_t clean) {
        return RegionRecord{
            .name = name, .object = object, .size = 4, .clean = clean, .share_mode = platform::SM_SHARED};
    };
    const json views = json::parse(document(
        {ready(1, {part("x", 1, 1), part("y", 2, 1)}), ready(2, {part("x", 1, 2), part("x", 2, 3)})}));
    for (const json& view : views["shared"]) {
        const bool isFirst = view["specific_to_pid"] == 1;
        EXPECT_EQ(view["categories"]["x"]["clean"], (isFirst ? 1 : 2) * page);
        EXPECT_EQ(view["categories"]["y"]["clean"], (isFirst ? 1 : 3) * page);
    }
}

TEST_F(JSONReport, AProcessWithErrorsHasNoResults) {
    const auto failed = ready(3, {{.object = 1, .size = 1, .dirty = 1}});
    failed->addError("refused");
    failed->_addGlobalError("interrupted");
    const json document = json::parse(this->document({failed, ready(2, {})}));
    EXPECT_EQ(document["errors"], (json{"interrupted", "refused"}));
    const json& process = document["processes"][0];
    EXPECT_EQ(process["errors"], json{"refused"});
    EXPECT_FALSE(process.contains("tally"));
    EXPECT_EQ(process["categories"], json::object());
    EXPECT_TRUE(process["auxiliary"].is_null());
    EXPECT_EQ(document["processes"][1]["tally"], 0);
}

TEST_F(JSONReport, StaysValidWhateverTheNamesHold) {
    const struct {
        std::string name, read;
    } cases[] = {
        {"a\"b\\c/", "a\"b\\c/"},
        {std::string("\0\x01\x1f\t\n\r\b\f\x7f", 9), std::string("\0\x01\x1f\t\n\r\b\f\x7f", 9)},
        {"\xc2\x85 \xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80",
         "\xc2\x85 \xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80"},
        {"\xff\x80", "\ufffd\ufffd"},                               // bytes that begin nothing
        {"\xe2\x82", "\ufffd\ufffd"},                               // cut off
        {"\xc0\xaf\xe0\x80\xaf", "\ufffd\ufffd\ufffd\ufffd\ufffd"}, // overlong
        {"\xed\xa0\x80", "\ufffd\ufffd\ufffd"},                     // a surrogate
        {"\xf4\x90\x80\x80", "\ufffd\ufffd\ufffd\ufffd"},           // beyond the last character
    };
    for (const auto& [name, read] : cases) {
        const auto process = ready(1, {{.name = "x", .object = 1, .size = 1}}, name.c_str());
        process->setName(name);
        process->memoryRegions()[0].name = Name(name);
        process->addWarning(name);
        process->aux = TLAuxDictionary{{{name, TLAuxData(1, true)}}};
        const std::string text = document({process}, {.listing = true});
        const json parsed = json::parse(text);
        EXPECT_EQ(parsed["processes"][0]["name"], read);
        EXPECT_EQ(parsed["processes"][0]["regions"][0]["name"], read);
        EXPECT_TRUE(parsed["processes"][0]["categories"].contains(read));
        EXPECT_EQ(parsed["processes"][0]["warnings"][0], read);
        EXPECT_TRUE(parsed["auxiliary"].contains(read));
        for (const char c : text) {
            EXPECT_TRUE(static_cast<unsigned char>(c) >= 0x20 && c != 0x7f) << "a control byte as it is";
        }
        EXPECT_EQ(text.find("\xc2\x85"), text.npos);
    }
}

} // namespace
} // namespace tally
