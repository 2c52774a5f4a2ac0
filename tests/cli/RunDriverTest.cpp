#include "cli/RunDriver.h"
#include "cli/CommandLine.h"
#include "cli/OutputFiles.h"
#include "output/TLOutputFormatterText.h"
#include "platform/scripted/ScriptedKernel.h"

#include <filesystem>
#include <fstream>

namespace tally {
namespace {

class RunDriver : public testing::Test {
  protected:
    RunDriver() {
        for (const std::int32_t pid : {7, 8, 9}) {
            kernel.addTask({.pid = pid, .name = "server"}).map({.start = 0x1000, .pages = "DD"});
        }
    }

    int run(const std::string& words) {
        CommandLine line(words);
        int status = -1;
        std::tie(output, messages) = written([&] { status = runTally(line.argc(), line.argv()); });
        return status;
    }

    platform::ScriptedKernel kernel;
    std::string output, messages;
};

TEST_F(RunDriver, EndsWithItsStatusAndMessages) {
    const std::string none =
        "Unable to find any processes matching the supplied process names or pids (try as root?)\n";
    const std::string unknown = "Unable to find pid for process matching 'nobody'\n";
    const std::string interval = "Invalid sampling interval '0'\n";
    enum Output { nothing, usage, report };
    const struct {
        std::string words;
        int status;
        Output output;
        std::string messages;
        std::uint32_t user = 0;
    } cases[] = {
        {"-h", 0, usage, ""},
        {"--sample 0", 1, usage, interval},
        {"", 1, usage, "Must specify at least one process or heapsnap\n"},
        {"nobody", 1, nothing, none},
        {"nobody server", 0, report, unknown},
        {"server", 0, report, "", 1000},
        {"-a -j x", 1, nothing, "Must run as root.\n", 1000},
        {"--unmapped server", 1, nothing, "Must run as root.\n", 1000},
        {"--vmObjectDirty -a", 0, report, ""},
        {"-j x --benchlog y server", 1, nothing, "Unable to create JSON output\n"},
        {"--benchlog x server", 1, nothing, "Unable to create benchlog output\n"},
        {"--sample 1 nobody", 1, nothing, none},
        {"--sample 1 server", 1, nothing, "Sampling is not available in this build\n"},
    };
    for (const auto& [words, status, wanted, text, user] : cases) {
        kernel.effectiveUserId = user;
        kernel.selfRegionTally = 0;
        EXPECT_EQ(run(words), status) << words;
        EXPECT_EQ(messages, text) << words;
        EXPECT_EQ(output.starts_with("Gather memory information"), wanted == usage);
        EXPECT_EQ(output.find("server [8]: 64-bit\tTally: 8192 B") != output.npos, wanted == report)
            << output;
        EXPECT_EQ(output.empty(), wanted == nothing) << output;
        if (wanted == report) { // the switch is for the default mode only
            EXPECT_EQ(kernel.selfRegionTally, words.starts_with("--vmObjectDirty") ? 0 : 1) << words;
        }
    }
    kernel.fail("proc_listallpids", 1, {.times = platform::Always});
    EXPECT_EQ(run("-a"), 1); // a failure that has no message
    EXPECT_EQ(messages, "");
    EXPECT_TRUE(output.starts_with("Gather memory information"));
}

TEST_F(RunDriver, ReportsWhatAnInterruptLeft) {
    for (const bool isTerminal : {false, true}) {
        kernel.outputIsTerminal = isTerminal;
        bool wasTaken = isTerminal;
        kernel.before("mach_get_times", [&] { wasTaken = kernel.interrupt(); });
        EXPECT_EQ(run("server"), 0);
        EXPECT_EQ(wasTaken, !isTerminal);
        EXPECT_EQ(messages, isTerminal ? "" : "Exiting early due to SIGINT\n");
        EXPECT_EQ(output.find("\tTally exited early due to SIGINT and did not finish gathering all data\n") !=
                      output.npos,
                  !isTerminal);
        EXPECT_FALSE(kernel.interrupt()); // the source is gone, and the default action is back
        EXPECT_EQ(kernel.callCount("restoreDefaultSigintAction"), 1U);
    }
}

TEST(OutputFiles, OnlyFilesOfFormattersAreDeleted) {
    std::ofstream("ours") << "text";
    std::ofstream("others") << "text";
    OutputFiles outputs;
    EXPECT_TRUE(
        outputs.add(std::make_shared<TLOutputFormatterText>(TLSummaryFormat::bytes, 0, "Dirty"), "ours"));
    EXPECT_FALSE(outputs.add(nullptr, "others"));
    outputs.deleteFiles();
    EXPECT_FALSE(std::filesystem::exists("ours"));
    EXPECT_TRUE(std::filesystem::remove("others"));
}

} // namespace
} // namespace tally
