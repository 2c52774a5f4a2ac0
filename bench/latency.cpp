// What a process with 2 GiB of memory in 4 KiB pages sees of being measured: the latency of its own mmap and
// munmap.
//
//   latency SECONDS COMMAND [ARGUMENT ...]   "PID" among the arguments stands for the process
//
// Prints the median, the 99th percentile and the maximum in microseconds, while COMMAND runs again and again;
// with "-" as COMMAND, of the undisturbed process.

#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <string>
#include <vector>

int main(int argc, char** argv) {
    if (argc < 3) {
        std::fprintf(stderr, "usage: latency SECONDS COMMAND [ARGUMENT ...]\n");
        return 2;
    }
    constexpr std::size_t size = std::size_t{2} << 30;
    constexpr std::size_t page = 4096;
    constexpr int access = PROT_READ | PROT_WRITE;
    constexpr int flags = MAP_PRIVATE | MAP_ANONYMOUS;
    char* memory = static_cast<char*>(mmap(nullptr, size, access, flags, -1, 0));
    madvise(memory, size, MADV_NOHUGEPAGE);
    for (std::size_t at = 0; at < size; at += page) {
        memory[at] = static_cast<char>(at / page + 1);
    }
    const std::string own = std::to_string(getpid());
    std::vector<char*> command;
    for (int i = 2; i < argc; ++i) {
        char* word = argv[i];
        command.push_back(std::strcmp(word, "PID") == 0 ? const_cast<char*>(own.c_str()) : word);
    }
    command.push_back(nullptr);
    const int disturber = std::strcmp(argv[2], "-") == 0 ? -1 : vfork();
    if (disturber == 0) {
        // A child of its own starts the command over and over, so that this process never forks its 2 GiB.
        std::string shell = "while :; do";
        for (char* word : command) {
            shell += word == nullptr ? "" : " '" + std::string(word) + "'";
        }
        shell += " > /dev/null 2>&1; done";
        execl("/bin/sh", "sh", "-c", shell.c_str(), nullptr);
        _exit(127);
    }
    using Clock = std::chrono::steady_clock;
    std::vector<double> microseconds;
    const auto end = Clock::now() + std::chrono::duration<double>(std::atof(argv[1]));
    while (Clock::now() < end) {
        const auto before = Clock::now();
        void* mapping = mmap(nullptr, 16 * page, access, flags, -1, 0);
        *static_cast<volatile char*>(mapping) = 1;
        munmap(mapping, 16 * page);
        microseconds.push_back(std::chrono::duration<double, std::micro>(Clock::now() - before).count());
        usleep(100);
    }
    if (disturber > 0) {
        kill(disturber, SIGKILL);
        waitpid(disturber, nullptr, 0);
    }
    std::sort(microseconds.begin(), microseconds.end());
    const auto quantile = [&](double part) {
        return microseconds[static_cast<std::size_t>(part * static_cast<double>(microseconds.size() - 1))];
    };
    std::printf("%.0f %.0f %.0f\n", quantile(0.5), quantile(0.99), quantile(1));
}
