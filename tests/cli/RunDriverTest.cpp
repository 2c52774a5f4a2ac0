#include "cli/RunDriver.h"
#include "cli/CommandLine.h"
#include "cli/Usage.h"
#include "platform/scripted/ScriptedKernel.h"

#include <filesystem>
#include <fstream>
#include <unistd.h>

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

TEST_F(RunDriver, TellsOnlyTheWorstOfTheListOfProcesses) {
    // A list that cannot be had is no fault of the names that were not found before.
    kernel.fail("proc_listallpids", 1, {.nth = 3, .times = platform::always});
    EXPECT_EQ(run("server nobody -t"), 1);
    EXPECT_EQ(messages, "Unable to obtain system process list\n");
}

TEST_F(RunDriver, ShowsInternalOptionsWhereTheirContentIs) {
    kernel.internalContent.insert(subsystemIdentifier);
    EXPECT_EQ(run("-h"), 0);
    EXPECT_TRUE(output.ends_with(". 0.5)\n\nKestrelInternal:\n    --benchlog <file.blj>                 "
                                 "print benchlog(1) output to a file\n"));
}

TEST_F(RunDriver, TurnsTheSwitchOnInTheDefaultModeAndNeverOff) {
    for (const auto& [words, value] :
         {std::pair("--vmObjectDirty server", 0), {"server", 1}, {"--vmObjectDirty server", 1}}) {
        EXPECT_EQ(run(words), 0);
        EXPECT_EQ(kernel.selfRegionTally, value);
    }
}

TEST_F(RunDriver, DeletesNoFileThatTookThePlaceOfItsOwn) {
    const std::string path = testing::TempDir() + "tally-file-" + std::to_string(getpid());
    kernel.before("proc_listallpids", [&] {
        std::filesystem::rename(path, path + "-moved");
        std::ofstream(path, std::ios::app);
    });
    EXPECT_EQ(run("nobody -j " + path), 1);
    EXPECT_TRUE(std::filesystem::remove(path) && std::filesystem::remove(path + "-moved"));
}

TEST_F(RunDriver, MeetsSignals) {
    const std::string early = "Exiting early due to SIGINT\n", finishing = "Finishing the output files\n";
    const struct {
        std::string words, call; // before which the signal comes
        bool isTerminal, isTermination, isTaken;
        std::string messages;
        std::size_t restored; // how often the default action was, before and after
    } cases[] = {
        {"server", "mach_get_times", false, false, true, early, 1},
        {"server", "mach_get_times", true, false, false, "", 0},
        {"server", "mach_get_times", false, true, false, "", 1},
        {"server -j /dev/null", "mach_get_times", false, true, true, early, 2},
        {"server -j /dev/null", "mach_get_times", true, false, false, "", 1}, // where it listens later
        {"server -j /dev/null", "fileInMemory", false, true, true, finishing, 2},
        {"server -j /dev/null", "fileInMemory", true, false, true, finishing, 2},
    };
    for (const auto& [words, call, isTerminal, isTermination, isTaken, expected, restored] : cases) {
        SCOPED_TRACE(words + " " + call + (isTerminal ? " terminal" : "") +
                     (isTermination ? " SIGTERM" : ""));
        const std::size_t before = kernel.callCount("restoreDefaultInterruptAction");
        kernel.outputIsTerminal = isTerminal;
        bool wasTaken = !isTaken;
        kernel.before(call, [&] {
            wasTaken = isTermination ? kernel.terminate() : kernel.interrupt();
            EXPECT_EQ(kernel.callCount("restoreDefaultInterruptAction") - before, restored == 2)
                << "the next one ends what writes files";
        });
        EXPECT_EQ(run(words), 0);
        EXPECT_EQ(wasTaken, isTaken);
        EXPECT_EQ(messages, expected);
        EXPECT_EQ(output.find("\tTally exited early due to SIGINT and did not finish gathering all data\n") !=
                      output.npos,
                  expected == early);
        EXPECT_FALSE(kernel.interrupt()); // the source is gone, and the default action is back
        EXPECT_EQ(kernel.callCount("restoreDefaultInterruptAction") - before, restored);
    }
}

} // namespace
} // namespace tally
