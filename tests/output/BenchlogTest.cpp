#include "analysis/ReadyProcess.h"
#include "output/TLOutputFormatterBenchlog.h"

#include <filesystem>
#include <fstream>

namespace tally {
namespace {

class Benchlog : public AnalysisTest {
  protected:
    ~Benchlog() override { std::filesystem::remove(path); }

    std::vector<std::string> lines() const {
        std::vector<std::string> result;
        std::ifstream file(path);
        for (std::string line; std::getline(file, line);) {
            result.push_back(line);
        }
        return result;
    }

    const std::string path = testing::TempDir() + "tally-test-" + std::to_string(getpid()) + ".blj";
};

TEST_F(Benchlog, HoldsAGroupPerProcessAndOneForTheSummary) {
    const RegionRecord shared{
        .name = "heap", .object = 2, .size = 3, .dirty = 3, .share_mode = platform::SM_SHARED};
    const auto first =
        ready(12, {{.name = "heap", .object = 1, .size = 9, .dirty = 2, .swapped = 1}, shared}, "a\"b");
    first->aux = TLAuxDictionary{{{"memory", TLAuxDictionary{{{"peak", TLAuxData(-7, true)}}}}}};
    const auto second = ready(3, {shared}, "all shared"); // a header, no categories of its own
    const auto failed = ready(2, {{.name = "total_memory", .object = 3, .size = 1, .dirty = 1}}, "failed");
    failed->addError("refused");
    failed->aux = TLAuxDictionary{{{"own", TLAuxData(8, false)}}};

    const auto formatter = TLOutputFormatterBenchlog::create(path);
    ASSERT_TRUE(formatter && formatter->supportsMultipleOutputs());
    for (int sample = 0; sample < 2; ++sample) {
        TLTally tally({first, second, failed});
        tally.addOutputFormatter(formatter);
        tally.analyzeMemoryObjects();
        tally.printReport(true, true);
    }
    EXPECT_EQ(formatter->close(), 0);
    std::vector<std::string> expected{
        R"({"benchlog":1,"benchmark":"tally.phys_tally","version":1,"description":"Memory measurements gathered )"
        R"(by the tally(1) tool","primary_metric":"total_memory,process=ALL_PROCESSES"})"};
    for (int sample = 0; sample < 2; ++sample) {
        const auto group = [&](int number) { return formatted(R"({"group":%d,)", sample * 4 + number); };
        const std::string summary = R"("metric":"total_memory","unit":"B","value":)";
        expected.insert(
            expected.end(),
            {group(1) + "TIME",
             group(1) + summary +
                 R"(24576,"variables":{"process":"a\"b"},"labels":{"pid":"12"},"tags":["summary"]})",
             group(1) + R"("metric":"heap","unit":"B","value":24576,"variables":{"process":"a\"b"}})",
             group(1) +
                 R"("metric":"aux_data.memory.peak","unit":"B","value":-7,"variables":{"process":"a\"b"},)"
                 R"("tags":["context"]})",
             group(2) + "TIME",
             group(2) + summary +
                 R"(12288,"variables":{"process":"all shared"},"labels":{"pid":"3"},"tags":["summary"]})",
             group(2) + R"("metric":"heap","unit":"B","value":12288,"variables":{"process":"all shared"}})",
             group(3) + "TIME",
             group(3) + R"("metric":"aux_data.own","unit":"B","value":8,"variables":{"process":"failed"},)"
                        R"("tags":["context"]})",
             group(4) + "TIME",
             group(4) + summary + R"(28672,"variables":{"process":"ALL_PROCESSES"},"tags":["summary"]})",
             group(4) +
                 R"("metric":"heap","unit":"B","value":24576,"variables":{"process":"ALL_PROCESSES"}})",
             group(4) +
                 R"-("metric":"total_memory (2)","unit":"B","value":4096,"variables":{"process":"ALL_PROCESSES"}})-",
             group(4) + R"("metric":"aux_data.memory.peak","unit":"B","value":-7,"variables":)"
                        R"({"process":"ALL_PROCESSES"},"tags":["context"]})",
             group(4) + R"("metric":"gather_duration","unit":"ms","value":0,"tags":["context"]})"});
    }
    std::vector<std::string> found = lines();
    for (std::string& line : found) {
        if (const std::size_t time = line.find("\"time\":17000000"); time != line.npos) {
            line.replace(time, line.npos, "TIME");
        }
    }
    EXPECT_EQ(found, expected);
}

TEST_F(Benchlog, TellsWholeMillisecondsOfGathering) {
    const auto formatter = TLOutputFormatterBenchlog::create(path);
    const std::pair<std::uint64_t, const char*> cases[] = {
        {999'999, "0"}, {1'999'999, "1"}, {5'000'000'000, "5000"}};
    for (const auto& [ticks, milliseconds] : cases) {
        formatter->startAtTime(TLTime(0, 100, 0));
        formatter->endAtTime(TLTime(0, 100 + ticks, 0));
    }
    formatter->close();
    const std::vector<std::string> found = lines();
    ASSERT_EQ(found.size(), 4U);
    for (std::size_t i = 0; i < 3; ++i) {
        EXPECT_NE(found[i + 1].find(std::string("\"value\":") + cases[i].second + ","), std::string::npos);
    }
}

TEST_F(Benchlog, WhatIsOnDiskIsWholeLinesAndLastsToTheLastGroup) {
    const auto formatter = TLOutputFormatterBenchlog::create(path);
    const auto process = ready(1, {});
    for (int group = 0; group < 2; ++group) {
        formatter->printProcessHeader(*process);
        formatter->printProcessTotal(std::uint64_t{1} << 62, *process);
        formatter->printProcessAuxData(TLAuxDictionary{{{std::string(2000, 'k'), TLAuxData(1, false)}}});
    }
    const std::vector<std::string> found = lines(); // as an end without close leaves it
    ASSERT_EQ(found.size(), 4U);
    EXPECT_NE(found[2].find("\"value\":4611686018427387904,"), std::string::npos);
    EXPECT_NE(found[3].find("\"aux_data." + std::string(1014, 'k') + "\","), std::string::npos); // 1023 bytes
    EXPECT_EQ(formatter->close(), 0);
    EXPECT_EQ(lines().size(), 7U);
}

} // namespace
} // namespace tally
