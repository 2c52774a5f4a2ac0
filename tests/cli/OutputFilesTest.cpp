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
    ~OutputFiles() override {
        fs::current_path(before);
        fs::remove_all(folder);
    }

    std::string path(const std::string& name) const { return folder / name; }
    void write(const std::string& name) const { std::ofstream(path(name)) << "before"; }
    std::string contents(const std::string& name) const {
        std::ostringstream text;
        text << std::ifstream(path(name)).rdbuf();
        return text.str();
    }

    int run(const std::string& words) {
        CommandLine line(words);
        int status = -1;
        std::tie(output, messages) = written([&] { status = runTally(line.argc(), line.argv()); });
        return status;
    }

    const fs::path folder = testing::TempDir() + "tally-files-" + std::to_string(getpid());
    const fs::path before = fs::current_path();
    platform::ScriptedKernel kernel;
    std::string output, messages;
};

TEST_F(OutputFiles, OfAFailedRunAreDeletedOnlyWhereTheyAreOurs) {
    EXPECT_EQ(run("nobody -j " + path("new") + " --benchlog " + path("new.blj")), 1);
    EXPECT_EQ(run("nobody -j " + path("x") + " --benchlog " + path("no/x")), 1);
    fs::create_symlink(path("nothing"), path("link"));
    EXPECT_EQ(run("nobody -j " + path("link")), 1);
    EXPECT_TRUE(fs::remove(path("link")));
    EXPECT_TRUE(fs::is_empty(folder));

    write("old");
    fs::create_symlink(path("old"), path("link"));
    ASSERT_EQ(mkfifo(path("fifo").c_str(), 0600), 0);
    const int reader = open(path("fifo").c_str(), O_RDONLY | O_NONBLOCK);
    for (const std::string words :
         {"-j old", "-j link", "-j fifo", "-j no/x --benchlog old", "-j old --benchlog no/x",
          "-j old --benchlog old", "-j old --benchlog link"}) {
        fs::current_path(folder);
        EXPECT_EQ(run("nobody " + words), 1);
        EXPECT_EQ(contents("old"), "before") << words;
        EXPECT_TRUE(fs::is_symlink("link") && fs::is_fifo("fifo"));
    }
    close(reader);
    EXPECT_EQ(run("server -j link"), 0); // a report empties it
    EXPECT_TRUE(contents("old").ends_with("}"));
    EXPECT_EQ(run("nobody -j /dev/null --benchlog /dev/null"), 1);
    EXPECT_TRUE(fs::is_character_file("/dev/null"));

    // Another file stands in the place of the one that was made.
    kernel.before("proc_listallpids", [&] {
        fs::rename(path("x"), path("moved"));
        write("x");
    });
    EXPECT_EQ(run("nobody -j " + path("x")), 1);
    EXPECT_TRUE(fs::exists(path("x")) && fs::exists(path("moved")));
}

TEST_F(OutputFiles, AreNeverWhatIsReadOrMeasured) {
    write("snapshot");
    fs::create_hard_link(path("snapshot"), path("twin"));
    for (const char* option : {"-j ", "--benchlog "}) {
        EXPECT_EQ(run(path("snapshot") + " server " + option + path("twin")), 1);
        EXPECT_EQ(messages, "What is to be read cannot be written to: " + path("twin") + "\n");
    }
    EXPECT_EQ(contents("snapshot"), "before");

    write("database"); // the report goes on without the document
    kernel.findTask(7)->map({.start = 0x100000, .pages = "CC", .file = path("database")});
    EXPECT_EQ(run("server -j " + path("database") + " --benchlog " + path("x.blj")), 1);
    EXPECT_EQ(messages, "server [7] maps " + path("database") + ", which is not written\n");
    EXPECT_EQ(contents("database"), "before");
    EXPECT_TRUE(output.starts_with("====") && fs::file_size(path("x.blj")) > 0);
}

TEST_F(OutputFiles, TwoDocumentsNeverShareAFile) {
    fs::create_hard_link((std::ofstream(path("a")), path("a")), path("b"));
    EXPECT_EQ(run("server -j " + path("a") + " --benchlog " + path("b")), 1);
    EXPECT_EQ(messages, "The JSON document and the performance data cannot share a file: " + path("b") +
                            "\nUnable to create benchlog output\n");
    EXPECT_TRUE(fs::exists(path("a")));
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
