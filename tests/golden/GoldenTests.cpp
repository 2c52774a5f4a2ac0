// Whole runs of the tool against what their case files say: both streams and the exit status, exactly.

#include "scripted/CaseFile.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/wait.h>

namespace tally {
namespace {

std::vector<std::string> caseNames() {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(GOLDEN_FOLDER)) {
        if (entry.path().extension() == ".case") {
            names.push_back(entry.path().stem());
        }
    }
    std::sort(names.begin(), names.end());
    return names;
}

std::string contents(const std::filesystem::path& path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

class Golden : public testing::TestWithParam<std::string> {};

TEST_P(Golden, PrintsWhatTheCaseSays) {
    const std::string path = std::string(GOLDEN_FOLDER) + "/" + GetParam() + ".case";
    const CaseFile file = CaseFile::read(path);
    ASSERT_FALSE(file.runs.empty());
    char folder[] = "/tmp/golden_XXXXXX"; // empty, so that no name of a case is a file's
    ASSERT_NE(mkdtemp(folder), nullptr);
    for (const auto& [name, text] : file.files) {
        std::ofstream(std::string(folder) + "/" + name) << text;
    }
    for (std::size_t run = 0; run < file.runs.size(); ++run) {
        const CaseRun& expected = file.runs[run];
        SCOPED_TRACE(path + ", run " + std::to_string(run + 1));
        const std::string command = std::string("cd ") + folder + " && " + expected.shell +
                                    " && TZ=UTC0 exec '" + TALLY_SCRIPTED + "' '" + path + "' " +
                                    std::to_string(run) + " >out 2>err";
        const int ended = std::system(command.c_str());
        EXPECT_TRUE(WIFEXITED(ended) && WEXITSTATUS(ended) == expected.status) << "wait status " << ended;
        const std::string out = contents(std::string(folder) + "/out");
        EXPECT_EQ(out.empty() || out.ends_with('\n') ? out : out + "\n", expected.standardOutput);
        EXPECT_EQ(contents(std::string(folder) + "/err"), expected.standardError);
        for (const auto& [name, text] : expected.files) {
            std::string found = contents(std::string(folder) + "/" + name);
            EXPECT_EQ(found.ends_with('\n') ? found : found + "\n", text);
        }
    }
    std::filesystem::remove_all(folder);
}

INSTANTIATE_TEST_SUITE_P(Case, Golden, testing::ValuesIn(caseNames()),
                         [](const auto& instance) { return instance.param; });

} // namespace
} // namespace tally
