#include "cli/HeapsnapDriver.h"
#include "cli/CommandLine.h"
#include "platform/quarry.h"
#include "platform/scripted/ScriptedKernel.h"

#include <filesystem>
#include <fstream>
#include <iterator>

namespace tally {
namespace {

using namespace platform;

class HeapsnapDriver : public testing::Test {
  protected:
    HeapsnapDriver() {
        kernel.addTask({.pid = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM});
        for (const std::int32_t pid : {7, 8}) {
            kernel.addTask({.pid = pid, .name = "server"}).map({.start = 0x1000, .pages = "DD"});
        }
        kernel.addTask({.pid = 9, .name = "one", .path = "/bin/o\033e"})
            .map({.start = 0x1000, .pages = "CC", .file = "/f"});
        kernel.addTask({.pid = 10, .name = "guarded", .portStatus = KERN_NO_ACCESS});
        std::filesystem::create_directories(folder);
        std::filesystem::current_path(folder);
    }
    ~HeapsnapDriver() override {
        std::filesystem::current_path("..");
        std::filesystem::remove_all(folder);
    }

    int run(const std::string& words) {
        CommandLine line(words);
        int status = -1;
        std::tie(output, messages) = written([&] { status = runHeapsnap(line.argc(), line.argv()); });
        return status;
    }

    static std::unique_ptr<QRYProcessObjectGraph> snapshotIn(const std::string& file) {
        std::ifstream stream(file, std::ios::binary);
        std::string error;
        return QRYDirectedGraphWithData(std::string(std::istreambuf_iterator<char>(stream), {}), &error);
    }

    const std::string folder = "heapsnaps-" + std::to_string(getpid()); // tests run side by side
    ScriptedKernel kernel;
    std::string output, messages;
};

TEST_F(HeapsnapDriver, WritesTheSnapshotOfOneProcess) {
    EXPECT_EQ(run("8"), 0) << messages;
    EXPECT_EQ(output, "server-8.heapsnap\n");
    EXPECT_EQ(snapshotIn("server-8.heapsnap")->pid(), 8);
    EXPECT_TRUE(snapshotIn("server-8.heapsnap")->showsPhysTally());
    EXPECT_EQ(run("9"), 0) << messages;
    EXPECT_EQ(output, "o?e-9.heapsnap\n") << "a name that is safe to print and to type";
    EXPECT_EQ(run("--vmObjectDirty -o x.heapsnap o\033e"), 0) << messages;
    EXPECT_EQ(output, "x.heapsnap\n");
    EXPECT_FALSE(snapshotIn("x.heapsnap")->showsPhysTally());
    EXPECT_EQ(kernel.heldPortReferences(), 0U);
}

TEST_F(HeapsnapDriver, SaysWhyThereIsNone) {
    const std::pair<std::string, std::string> cases[] = {
        {"server", "Several processes match 'server', name one by its pid: 7 8\n"},
        {"no\tbody", "Unable to find pid for process matching 'no?body'\n"},
        {"kernel", "The kernel has no address space to take a snapshot of\n"},
        {"10", "task_read_for_pid: no access\nUnable to analyze process with pid 10 (try as root?)\n"},
        {"-o /f 9", "o?e [9] maps /f, which is not written\n"},
        {"-o nowhere/x 7", "Unable to write nowhere/x: No such file or directory\n"},
        {"-o /dev/full 7", "Unable to write /dev/full: No space left on device\n"},
        {"7", "mach_vm_region_recurse: failure\nbailing out for process server [7]; data may be incomplete!\n"
              "server [7]: failure\n"},
    };
    for (const auto& [words, message] : cases) {
        if (words == "7") {
            kernel.fail("mach_vm_region_recurse", KERN_FAILURE);
        }
        EXPECT_EQ(run(words), 1) << words;
        EXPECT_EQ(messages, message);
        EXPECT_EQ(output, "");
    }
    EXPECT_TRUE(std::filesystem::is_empty("."));
    for (const char* words : {"", "7 8", "--nothing 7"}) {
        EXPECT_EQ(run(words), 1) << words;
        EXPECT_NE(messages.find("Usage: heapsnap [--vmObjectDirty] [-o FILE] PID|NAME\n"), std::string::npos);
    }
    EXPECT_EQ(run("7 --help"), 0);
    EXPECT_TRUE(output.starts_with("Write a snapshot"));
}

} // namespace
} // namespace tally
