#include "cli/RunDriver.h"
#include "cli/CommandLine.h"
#include "platform/scripted/ScriptedKernel.h"

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

TEST_F(RunDriver, EndsWithItsStatusAndMessage) {
    const struct {
        std::string words, message;
    } cases[] = {
        {"--unmapped server", "Must run as root.\n"},
        {"-j . server", "Unable to open JSON writer: Is a directory\nUnable to create JSON output\n"},
        {"--benchlog no/x server",
         "Unable to open blwriter: No such file or directory\nUnable to create benchlog output\n"},
        {"--sample 1 nobody",
         "Unable to find any processes matching the supplied process names or pids (try as root?)\n"},
    };
    kernel.effectiveUserId = 1000;
    for (const auto& [words, message] : cases) {
        EXPECT_EQ(run(words), 1) << words;
        EXPECT_EQ(messages, message);
        EXPECT_EQ(output, "") << words;
    }
    // A list of processes that cannot be had is no fault of the names that were not found before.
    kernel.fail("proc_listallpids", 1, {.nth = 3, .times = platform::always});
    EXPECT_EQ(run("server nobody -t"), 1);
    EXPECT_EQ(messages, "Unable to obtain system process list\n");
    EXPECT_TRUE(output.starts_with("Gather memory information"));
}

TEST_F(RunDriver, TurnsTheSwitchOnInTheDefaultModeAndNeverOff) {
    for (const auto& [words, value] :
         {std::pair("--vmObjectDirty server", 0), {"server", 1}, {"--vmObjectDirty server", 1}}) {
        EXPECT_EQ(run(words), 0);
        EXPECT_EQ(kernel.selfRegionTally, value);
    }
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
        EXPECT_EQ(kernel.callCount("restoreDefaultInterruptAction"), 1U);
    }
}

TEST_F(RunDriver, TerminationEndsEarlyOnlyWhatWritesFiles) {
    for (const bool writesFile : {true, false}) {
        bool wasTaken = !writesFile;
        kernel.before("mach_get_times", [&] { wasTaken = kernel.terminate(); });
        EXPECT_EQ(run(writesFile ? "server -j /dev/null" : "server"), 0);
        EXPECT_EQ(wasTaken, writesFile);
        EXPECT_EQ(messages, writesFile ? "Exiting early due to SIGINT\n" : "");
    }
}

TEST_F(RunDriver, AnInterruptOfTheReportFinishesTheFiles) {
    for (const bool isTerminal : {false, true}) {
        kernel.outputIsTerminal = isTerminal;
        bool wasTaken = false;
        kernel.before("fileInMemory", [&] {
            wasTaken = kernel.terminate();
            EXPECT_EQ(kernel.callCount("restoreDefaultInterruptAction"), isTerminal ? 3U : 1U)
                << "the next one ends it";
        });
        EXPECT_EQ(run("server -j /dev/null"), 0);
        EXPECT_TRUE(wasTaken);
        EXPECT_EQ(messages, "Finishing the output files\n");
    }
}

} // namespace
} // namespace tally
