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
