// Corpses of real processes: that they show one instant, and that the processes run on as if nothing had
// been.

#include "linux/Puppet.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"
#include "process/TLCorpseProcess.h"
#include "vm/PhysTallyCollection.h"

#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <filesystem>
#include <fstream>
#include <random>
#include <set>
#include <thread>

namespace tally::test {
namespace {

using namespace platform;
using namespace std::chrono_literals;

PortRight portOf(int pid) {
    mach_port_t task = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(pid, &task), KERN_SUCCESS);
    return PortRight(task);
}

/// What the status file of a thread says behind `key`; empty when the thread has ended.
std::string statusOf(const std::filesystem::path& thread, const std::string& key) {
    std::ifstream file(thread / "status");
    std::string word;
    while (file >> word && word != key) {
    }
    file >> word;
    return word;
}

/// Expects to see soon `threads` threads that nobody traces, all in one of the states `states`.
void expectThreads(int pid, std::size_t threads, const std::string& states) {
    std::string seen;
    const auto areAsExpected = [&] {
        seen.clear();
        for (const auto& entry :
             std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task")) {
            const bool isTraced = statusOf(entry.path(), "TracerPid:") != "0";
            seen += isTraced ? "traced" : statusOf(entry.path(), "State:");
        }
        return seen.size() == threads && seen.find_first_not_of(states) == std::string::npos;
    };
    for (int i = 0; i < 1000 && !areAsExpected(); ++i) { // they have to run to stop again
        std::this_thread::sleep_for(10ms);
    }
    EXPECT_TRUE(areAsExpected()) << seen;
}

/// Waits until the process is traced, or may have been.
void awaitTracer(int pid) {
    const std::string folder = "/proc/" + std::to_string(pid);
    const auto deadline = std::chrono::steady_clock::now() + 200ms;
    while (statusOf(folder, "TracerPid:") == "0" && std::chrono::steady_clock::now() < deadline) {
    }
}

void stop(int pid) {
    siginfo_t stopped{};
    kill(pid, SIGSTOP);
    waitid(P_PID, static_cast<id_t>(pid), &stopped, WSTOPPED);
}

/// Makes a corpse of `task`. @return what it is charged; 0 with `*status` when there is none.
std::uint64_t examineCorpse(const PortRight& task, kern_return_t* status) {
    mach_port_t port = MACH_PORT_NULL;
    *status = task_generate_corpse(task.name(), &port);
    if (*status != KERN_SUCCESS) {
        EXPECT_EQ(port, MACH_PORT_NULL);
        return 0;
    }
    const PortRight given(port);
    const auto corpse = TLCorpseProcess::initWithCorpse(port);
    if (!corpse) {
        ADD_FAILURE() << "no crash information";
        return 0;
    }
    corpse->gatherData();
    std::uint64_t held = 0;
    for (const TLMemoryRegion& region : corpse->memoryRegions()) {
        held += region.dirtySize + region.swappedSize;
    }
    EXPECT_EQ(held, corpse->phys_tally()) << "regions and ledger of one instant";
    if (isRoot()) { // others are refused files of a process that ends
        EXPECT_EQ(corpse->warnings(), std::vector<std::string>());
    }
    return held;
}

class Corpse : public testing::Test {
  protected:
    Corpse() { setPhysTallyCollectionEnabled(1); }
    ~Corpse() override { setPhysTallyCollectionEnabled(0); }
};

TEST_F(Corpse, ShowsOneInstantOfTwoHundredThreadsThatMapAndUnmap) {
    const Puppet puppet({"churn", "200"});
    const PortRight task = portOf(puppet.pid());
    std::set<std::uint64_t> tallies;
    for (int round = 0; round < 20; ++round) {
        kern_return_t status = KERN_FAILURE;
        tallies.insert(examineCorpse(task, &status));
        ASSERT_EQ(status, KERN_SUCCESS);
        expectThreads(puppet.pid(), 201, "RSD");
    }
    EXPECT_GT(tallies.size(), 5U) << "nothing changes, so that nothing is shown";
}

TEST_F(Corpse, LeavesAStoppedProcessStoppedAndItsContinuingPossible) {
    const Puppet puppet({"idle"});
    const PortRight task = portOf(puppet.pid());
    stop(puppet.pid());
    for (const std::string states : {"T", "RS"}) {
        kern_return_t status = KERN_FAILURE;
        EXPECT_GT(examineCorpse(task, &status), 0U);
        expectThreads(puppet.pid(), 1, states);
        siginfo_t continued{};
        kill(puppet.pid(), SIGCONT);
        waitid(P_PID, static_cast<id_t>(puppet.pid()), &continued, WCONTINUED | WNOHANG);
    }
}

volatile int* signalsTaken = nullptr; // shared with the child that takes them

TEST_F(Corpse, LosesNoSignalOnItsWay) {
    void* const shared = mmap(nullptr, 4096, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0);
    signalsTaken = static_cast<volatile int*>(shared);
    signal(SIGRTMIN, [](int) { *signalsTaken = *signalsTaken + 1; });
    const pid_t pid = fork();
    if (pid == 0) {
        alarm(60);
        for (;;) {
        }
    }
    std::atomic<bool> isOver = false;
    int sent = 0;
    std::thread sender([&] {
        while (!isOver) {
            sent += sigqueue(pid, SIGRTMIN, {}) == 0 ? 1 : 0;
            std::this_thread::sleep_for(20us);
        }
    });
    const PortRight task = portOf(pid);
    for (int round = 0; round < 40; ++round) {
        kern_return_t status = KERN_FAILURE;
        examineCorpse(task, &status);
        EXPECT_EQ(status, KERN_SUCCESS);
    }
    isOver = true;
    sender.join();
    for (int i = 0; i < 1000 && *signalsTaken != sent; ++i) {
        std::this_thread::sleep_for(10ms);
    }
    EXPECT_EQ(*signalsTaken, sent);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    signal(SIGRTMIN, SIG_DFL);
    munmap(shared, 4096);
}

TEST_F(Corpse, OfAProcessThatEndsMeanwhileIsWholeOrNone) {
    std::mt19937 random(2);
    int whole = 0;
    constexpr int rounds = 30;
    for (int round = 0; round < rounds; ++round) {
        const Puppet puppet({"churn", "20"});
        const PortRight task = portOf(puppet.pid());
        std::thread killer([&] {
            awaitTracer(puppet.pid());
            std::this_thread::sleep_for(std::chrono::microseconds(random() % (100 * rounds)));
            kill(puppet.pid(), SIGKILL);
        });
        kern_return_t status = KERN_FAILURE;
        examineCorpse(task, &status);
        EXPECT_TRUE(status == KERN_SUCCESS || status == KERN_TERMINATED) << mach_error_string(status);
        whole += status == KERN_SUCCESS ? 1 : 0;
        killer.join();
    }
    EXPECT_LT(whole, rounds) << "all ended too late";
}

/// The kernel lets no program be loaded before whoever traces the threads that it ends has taken note of
/// that.
TEST_F(Corpse, OfAProcessThatLoadsProgramsIsWholeOrNone) {
    const Puppet puppet({"reload"});
    int whole = 0;
    for (int round = 0; round < 200; ++round) {
        const PortRight task = portOf(puppet.pid());
        kern_return_t status = KERN_FAILURE;
        examineCorpse(task, &status);
        EXPECT_TRUE(status == KERN_SUCCESS || status == KERN_TERMINATED) << mach_error_string(status);
        whole += status == KERN_SUCCESS ? 1 : 0;
    }
    EXPECT_GT(whole, 0);
}

/// Pages of a corpse between two addresses: its own, and those it shares with relatives.
std::pair<std::uint32_t, std::uint32_t> ownAndShared(const PortRight& corpse, std::uint64_t start,
                                                     std::uint64_t end) {
    std::pair<std::uint32_t, std::uint32_t> pages;
    vm_region_submap_info_64 info;
    for (std::uint64_t size = 0, at = start; at < end; at += size) {
        std::uint32_t depth = 0;
        std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        if (mach_vm_region_recurse(corpse.name(), &at, &size, &depth, &info, &count) != KERN_SUCCESS) {
            break;
        }
        (info.share_mode == SM_COW ? pages.second : pages.first) += at < end ? info.pages_resident : 0;
    }
    return pages;
}

TEST_F(Corpse, SharesNothingWithARelativeThatWasForkedLater) {
    if (!isRoot()) {
        GTEST_SKIP() << "frame numbers are for root";
    }
    constexpr std::size_t size = 64 * 4096;
    void* const guarded = mmap(nullptr, 3 * size, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    char* const memory = static_cast<char*>(guarded) + size;
    mprotect(memory, size, PROT_READ | PROT_WRITE);
    madvise(memory, size, MADV_NOHUGEPAGE);
    int go[2];
    int told[2];
    ASSERT_TRUE(pipe(go) == 0 && pipe(told) == 0);
    pid_t pid = 0;
    const pid_t child = fork();
    if (child == 0) {
        alarm(60);
        for (std::size_t at = 0; at < size; at += 4096) {
            memory[at] = 1;
        }
        bool isTold = write(told[1], &pid, sizeof pid) == sizeof pid && read(go[0], &pid, 1) == 1;
        pid = fork();
        alarm(60);
        isTold = isTold && (pid == 0 || write(told[1], &pid, sizeof pid) == sizeof pid);
        for (;;) {
            pause();
        }
    }
    mach_port_t port = MACH_PORT_NULL;
    EXPECT_EQ(read(told[0], &pid, sizeof pid), static_cast<ssize_t>(sizeof pid));
    EXPECT_EQ(task_generate_corpse(portOf(child).name(), &port), KERN_SUCCESS);
    const PortRight before(port);
    EXPECT_EQ(write(go[1], "x", 1), 1);
    EXPECT_EQ(read(told[0], &pid, sizeof pid), static_cast<ssize_t>(sizeof pid));
    EXPECT_EQ(task_generate_corpse(portOf(pid).name(), &port), KERN_SUCCESS);
    const PortRight after(port);
    const auto start = reinterpret_cast<std::uint64_t>(memory);
    for (const PortRight* corpse : {&before, &after}) {
        EXPECT_EQ(ownAndShared(*corpse, start, start + size), (std::pair{64U, 0U}));
    }
    kill(pid, SIGKILL);
    kill(child, SIGKILL);
    waitpid(child, nullptr, 0);
    munmap(guarded, 3 * size);
    for (const int end : {go[0], go[1], told[0], told[1]}) {
        close(end);
    }
}

TEST_F(Corpse, OfAProcessThatWaitsInTheKernelIsGivenUp) {
    const pid_t waiting = fork();
    if (waiting == 0) { // in the kernel, for what a child of it does
        setpgid(0, 0);
        if (vfork() == 0) {
            alarm(60);
            pause();
        }
        _exit(0);
    }
    std::this_thread::sleep_for(100ms);
    mach_port_t corpse = MACH_PORT_NULL;
    EXPECT_EQ(task_generate_corpse(portOf(waiting).name(), &corpse), KERN_OPERATION_TIMED_OUT);
    kill(-waiting, SIGKILL); // the child as well, which has what reads the test's output wait for it
    waitpid(waiting, nullptr, 0);
}

} // namespace
} // namespace tally::test
