// What a process sees of being stopped: the longest time that a spinning thread of it stood still.
//
//   stop SECONDS MIB THREADS COMMAND [ARGUMENT ...]   "PID" among the arguments stands for the process
//
// The process has MIB of memory in 4 KiB pages, and THREADS threads that sleep besides the one that spins.
// Prints the median and the maximum, of all runs of COMMAND, of the longest gap in microseconds, and how many
// runs there were; with "-" as COMMAND, of as many undisturbed turns of 20 ms.

#include <spawn.h>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <thread>
#include <vector>

namespace {

using Clock = std::chrono::steady_clock;

/// Spins until `isOver`, which is asked once a millisecond. @return the longest gap between two looks at the
/// clock, in microseconds.
template <typename IsOver>
double longestGap(const IsOver& isOver) {
    Clock::duration longest{};
    auto last = Clock::now();
    for (auto next = last + std::chrono::milliseconds(1);;) {
        const auto now = Clock::now();
        longest = std::max(longest, now - last);
        last = now;
        if (now >= next) {
            if (isOver()) {
                return std::chrono::duration<double, std::micro>(longest).count();
            }
            last = Clock::now();
            next = last + std::chrono::milliseconds(1);
        }
    }
}

} // namespace

int main(int argc, char** argv) {
    if (argc < 5) {
        std::fprintf(stderr, "usage: stop SECONDS MIB THREADS COMMAND [ARGUMENT ...]\n");
        return 2;
    }
    const std::size_t size = std::strtoul(argv[2], nullptr, 0) << 20;
    char* memory = static_cast<char*>(
        mmap(nullptr, size + 1, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));
    madvise(memory, size, MADV_NOHUGEPAGE);
    for (std::size_t at = 0; at < size; at += 4096) {
        memory[at] = 1;
    }
    for (long i = std::atol(argv[3]); i > 0; --i) {
        std::thread([] { pause(); }).detach();
    }
    std::string own = std::to_string(getpid());
    std::vector<char*> command;
    for (int i = 4; i < argc; ++i) {
        command.push_back(std::strcmp(argv[i], "PID") == 0 ? own.data() : argv[i]);
    }
    command.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
    const bool isDisturbed = std::strcmp(argv[4], "-") != 0;
    std::vector<double> gaps;
    for (const auto end = Clock::now() + std::chrono::seconds(std::atol(argv[1])); Clock::now() < end;) {
        pid_t pid = 0;
        const auto start = Clock::now();
        if (isDisturbed && posix_spawn(&pid, command[0], &actions, nullptr, command.data(), environ) != 0) {
            std::perror(command[0]);
            return 1;
        }
        gaps.push_back(longestGap([&] {
            return isDisturbed ? waitpid(pid, nullptr, WNOHANG) == pid
                               : Clock::now() - start > std::chrono::milliseconds(20);
        }));
        // A thread that no other may displace, as chrt makes one, is made to rest after 950 ms of a second.
        std::this_thread::sleep_for((Clock::now() - start) / 8);
    }
    std::sort(gaps.begin(), gaps.end());
    std::printf("%.0f %.0f %zu\n", gaps[gaps.size() / 2], gaps.back(), gaps.size());
    std::fflush(stdout);
    _exit(0); // the other threads sleep
}
