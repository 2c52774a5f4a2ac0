#include "analysis/ReadyProcess.h"
#include "output/TLOutputFormatterJSON.h"

#include <nlohmann/json.hpp>

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
    ~JSONReport() override { std::filesystem::remove(path); }

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
        std::ostringstream text;
        text << std::ifstream(path).rdbuf();
        return text.str();
    }

    const std::string path = testing::TempDir() + "tally-report-" + std::to_string(getpid()) + ".json";
};

TEST_F(JSONReport, SamplesStandBesideEachOther) {
    const RegionRecord shared{.object = 1, .size = 1, .dirty = 1};
    const auto process = ready(7, {shared});
    process->setPageSize(16384);
    const std::string text = document({process, ready(6, {shared})}, {.samples = 3});
    const auto parsed = nlohmann::ordered_json::parse(text);
    ASSERT_EQ(parsed.at("samples").size(), 3U);
    EXPECT_EQ((++parsed.rbegin()).key(), "samples");
    EXPECT_EQ(parsed.rbegin().key(), "page size");
    EXPECT_EQ(parsed.at("page size"), 16384);
    for (const auto& sample : parsed["samples"]) {
        EXPECT_EQ(sample.size(), 9U);
        EXPECT_EQ(sample["shared"].size(), 1U) << "each report tells the group once";
    }
    EXPECT_TRUE(text.ends_with(R"(}}],"page size":16384})"));
    EXPECT_EQ(json::parse(document({}, {.samples = 1}))["samples"].size(), 1U);
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
