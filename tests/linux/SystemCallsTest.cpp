// What measuring costs in system calls, per mapping and per process: a call too many in either loop is found
// here before it is felt.

#include "linux/Puppet.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <csignal>
#include <cstdlib>
#include <fstream>
#include <iterator>
#include <memory>
#include <set>

namespace tally::test {
namespace {

/// By how much counts differ: where the kernel puts mappings matters, and what others have freed lazily.
constexpr int noise = 60;

/// Calls of the allocator and of threads that wait for each other: they are not the tool's own.
bool isOfTheRuntime(std::uint64_t number) {
    static const std::set<std::uint64_t> numbers{
        SYS_brk,   SYS_mmap,        SYS_munmap,         SYS_mremap,          SYS_mprotect,       SYS_madvise,
        SYS_futex, SYS_sched_yield, SYS_rt_sigprocmask, SYS_clock_nanosleep, SYS_restart_syscall};
    return numbers.contains(number);
}

void counted(std::vector<std::string> words) {
    std::vector<char*> arguments;
    for (std::string& word : words) {
        arguments.push_back(word.data());
    }
    arguments.push_back(nullptr);
    ptrace(PTRACE_TRACEME, 0, nullptr, nullptr);
    setenv("ASAN_OPTIONS", "detect_leaks=0", 1); // it cannot look for leaks while it is traced
    dup2(open("/dev/null", O_WRONLY), STDOUT_FILENO);
    raise(SIGSTOP);
    execv(TALLY_PROGRAM, arguments.data());
    _exit(127);
}

/// How many system calls the tool makes with these arguments.
int systemCalls(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {TALLY_PROGRAM, "-w"});
    const int child = fork();
    if (child == 0) {
        counted(arguments);
    }
    int calls = 0;
    int status = 0;
    waitpid(child, &status, __WALL);
    ptrace(PTRACE_SETOPTIONS, child, nullptr,
           PTRACE_O_TRACESYSGOOD | PTRACE_O_TRACECLONE | PTRACE_O_TRACEEXEC | PTRACE_O_EXITKILL);
    ptrace(PTRACE_SYSCALL, child, nullptr, 0);
    for (int stopped; (stopped = waitpid(-1, &status, __WALL)) > 0;) {
        if (!WIFSTOPPED(status)) {
            if (stopped == child) {
                break;
            }
            continue;
        }
        const bool isCall = WSTOPSIG(status) == (SIGTRAP | 0x80);
        if (isCall) {
            __ptrace_syscall_info info{};
            ptrace(PTRACE_GET_SYSCALL_INFO, stopped, sizeof(info), &info);
            calls += info.op == PTRACE_SYSCALL_INFO_ENTRY && !isOfTheRuntime(info.entry.nr) ? 1 : 0;
        }
        const bool isSignal = !isCall && WSTOPSIG(status) != SIGTRAP && WSTOPSIG(status) != SIGSTOP;
        ptrace(PTRACE_SYSCALL, stopped, nullptr, isSignal ? WSTOPSIG(status) : 0);
    }
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << status;
    return calls;
}

int callsForMappings(int mappings) {
    const Puppet puppet({"maps", std::to_string(mappings)});
    return systemCalls({"--pid", std::to_string(puppet.pid())});
}

TEST(SystemCalls, AreOneAMappingAndFarLessWhereThereAreThousands) {
    if (isKernelBefore(6, 7)) {
        GTEST_SKIP() << "this kernel's page tables are read, and not asked for what is there";
    }
    const int few = callsForMappings(400);
    EXPECT_LE(callsForMappings(1400) - few, 1050);
    const int many = callsForMappings(4000);
    EXPECT_LE(callsForMappings(8000) - many, 200);
}

TEST(SystemCalls, DoNotGrowWithMemory) {
    const Puppet small({"big", "8"});
    const Puppet large({"big", "264"});
    EXPECT_LE(systemCalls({"--pid", std::to_string(large.pid())}) -
                  systemCalls({"--pid", std::to_string(small.pid())}),
              noise);
}

TEST(SystemCalls, DoNotGrowWithReservedAddresses) {
    if (isKernelBefore(6, 7)) {
        GTEST_SKIP() << "this kernel's page tables are read, and not asked for what is there";
    }
    const auto callsFor = [](const char* how) {
        const Puppet family({"family", "2", "16", how});
        std::vector<std::string> arguments{"--pid", std::to_string(family.pid())};
        for (const Puppet::Entry& entry : family.ledger()) {
            if (entry.name == "child") {
                arguments.insert(arguments.end(), {"--pid", std::to_string(entry.size)});
            }
        }
        return systemCalls(arguments);
    };
    const int few = callsFor("reserve1");
    EXPECT_LE(callsFor("reserve2") - few, noise);
    EXPECT_LE(callsFor("reserve32") - few, noise);
}

TEST(SystemCalls, AreFewAProcessBesidesItsMappings) {
    std::vector<std::unique_ptr<Puppet>> puppets;
    std::vector<std::string> arguments;
    std::vector<int> calls;
    for (const std::size_t count : {2U, 12U}) {
        while (puppets.size() < count) {
            puppets.push_back(std::make_unique<Puppet>(std::vector<std::string>{"idle"}));
            arguments.insert(arguments.end(), {"--pid", std::to_string(puppets.back()->pid())});
        }
        calls.push_back(systemCalls(arguments));
    }
    std::ifstream maps("/proc/" + std::to_string(puppets[0]->pid()) + "/maps");
    const auto mappings = std::count(std::istreambuf_iterator<char>(maps), {}, '\n');
    constexpr int most = 55 + 7; // the 7 while any process has lazily freed memory
    EXPECT_LE(calls[1] - calls[0], 10 * (mappings + most));
}

} // namespace
} // namespace tally::test
