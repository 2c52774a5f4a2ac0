#include "cli/CommandLine.h"
#include "cli/RunDriver.h"
#include "platform/scripted/ScriptedKernel.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

namespace tally {
namespace {

namespace fs = std::filesystem;

class OutputFiles : public testing::Test {
  protected:
    OutputFiles() {
        fs::create_directory(folder);
        kernel.addTask({.pid = 7, .name = "server"}).map({.start = 0x1000, .pages = "DD"});
    }
    ~OutputFiles() override { fs::remove_all(folder); }

    std::string path(const std::string& name) const { return folder / name; }

    int run(const std::string& words) {
        CommandLine line(words);
        int status = -1;
        std::tie(output, messages) = written([&] { status = runTally(line.argc(), line.argv()); });
        return status;
    }

    const fs::path folder = testing::TempDir() + "tally-files-" + std::to_string(getpid());
    platform::ScriptedKernel kernel;
    std::string output, messages;
};

TEST_F(OutputFiles, OfAFailedRunAreDeletedOnlyWhereTheyAreOurs) {
    const auto write = [&](const char* name) { std::ofstream(path(name)) << "before"; };
    EXPECT_EQ(run("nobody -j " + path("new") + " --benchlog " + path("new.blj")), 1);
    EXPECT_TRUE(fs::is_empty(folder));
    write("old");
    EXPECT_EQ(run("nobody -j " + path("old")), 1); // emptied by this run, so of no more use
    EXPECT_FALSE(fs::exists(path("old")));

    write("kept.blj"); // its formatter was never made
    EXPECT_EQ(run("nobody -j " + path("no/x") + " --benchlog " + path("kept.blj")), 1);
    EXPECT_EQ(fs::file_size(path("kept.blj")), 6U);
    EXPECT_EQ(run("nobody -j " + path("x") + " --benchlog " + path("no/x")), 1);
    EXPECT_FALSE(fs::exists(path("x")));

    write("target");
    fs::create_symlink(path("target"), path("link"));
    ASSERT_EQ(mkfifo(path("fifo").c_str(), 0600), 0);
    const int reader = open(path("fifo").c_str(), O_RDONLY | O_NONBLOCK);
    for (const char* name : {"link", "fifo"}) {
        EXPECT_EQ(run("nobody -j " + path(name)), 1);
        EXPECT_TRUE(fs::exists(fs::symlink_status(path(name)))) << name;
    }
    close(reader);
    EXPECT_EQ(run("nobody -j /dev/null --benchlog /dev/null"), 1);
    EXPECT_TRUE(fs::is_character_file("/dev/null"));

    // Another file stands in the place of the one that was opened.
    kernel.before("proc_listallpids", [&] {
        fs::rename(path("x"), path("moved"));
        write("x");
    });
    EXPECT_EQ(run("nobody -j " + path("x")), 1);
    EXPECT_TRUE(fs::exists(path("x")) && fs::exists(path("moved")));
}

TEST_F(OutputFiles, TwoDocumentsNeverShareAFile) {
    fs::create_hard_link((std::ofstream(path("a")), path("a")), path("b"));
    EXPECT_EQ(run("server -j " + path("a") + " --benchlog " + path("b")), 1);
    EXPECT_EQ(messages, "The JSON document and the performance data cannot share a file: " + path("b") +
                            "\nUnable to create benchlog output\n");
    EXPECT_FALSE(fs::exists(path("a")));
    EXPECT_EQ(run("server -j /dev/null --benchlog /dev/null"), 0);
    EXPECT_EQ(messages, "");
}

TEST_F(OutputFiles, ADocumentFollowsTheTextOnStandardOutput) {
    for (const char* words : {"server --benchlog /dev/stdout", "server -j /dev/stdout"}) {
        EXPECT_EQ(run("server"), 0);
        const std::string text = output;
        EXPECT_EQ(run(words), 0);
        EXPECT_TRUE(output.starts_with(text + "{\"")) << output;
    }
    EXPECT_TRUE(output.ends_with("\"page size\":4096}"));
    // The path of the file that standard output goes to, and a run that fails.
    EXPECT_EQ(run("nobody -j /dev/stdout"), 1);
    EXPECT_EQ(output, "");
}

TEST_F(OutputFiles, SayWhenTheyAreIncomplete) {
    EXPECT_EQ(run("server -j /dev/full --benchlog /dev/full"), 1);
    EXPECT_EQ(messages, "Unable to write all of /dev/full, which is incomplete: No space left on device\n"
                        "Unable to write all of /dev/full, which is incomplete: No space left on device\n");
    EXPECT_TRUE(output.starts_with("====")); // the text is there all the same
}

} // namespace
} // namespace tally
