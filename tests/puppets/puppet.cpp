// A program that does with memory what a test asks for, says what it did, and holds still until its input
// closes.
//
//   puppet zoo                     one mapping of every kind of memory
//   puppet share PATH              maps the file at PATH shared, reads it all
//   puppet fill PATH PAGES         maps the file at PATH shared, writes its first PAGES pages
//   puppet big MIB                 private memory, every page written
//   puppet maps COUNT              COUNT mappings of one page each, every second one written
//   puppet reload                  60 threads, the last of which loads the program again, without end
//   puppet churn [THREADS]         maps and unmaps without end, so many more threads too
//   puppet breathe                 grows, shrinks and forks children that end, without end
//   puppet family KIDS PAGES HOW   forks KIDS children that share PAGES pages and change them. HOW is
//                                  one of same, half (every second page written), random (three pages in
//                                  ten, drawn by the child's number), drop (the second half unmapped),
//                                  huge (huge pages, the first 4 KiB of each written), grow (the parent's
//                                  and the children's mappings grow apart), leaderless (nothing changes, the
//                                  children's first threads end), reserveN (mappings of N TiB, private
//                                  and shared, with PAGES pages all over each, are inherited as well), freed
//                                  (lazily, before), swapped (nothing changes: it was swapped out before, and
//                                  shared memory of as many pages with it)
//   puppet memory PAGES            a memfd of PAGES pages, all written, of which only the first are mapped
//                                  and touched
//   puppet twins                   a second process in the same address space
//   puppet leaderless              the first thread ends, another lives on
//   puppet refuse NUMBER COMMAND   runs COMMAND with every ioctl of that request number answered by EPERM,
//                                  of a small number the system call, for number 0 ptrace; "NUMBER:ERROR"
//                                  by another error; "fixed" in place of a number runs it without
//                                  randomised addresses
//
// Every line of output is "name address bytes key=bytes ...", what the mapping must show; "ready" ends the
// ledger.

#include "Memory.h"
#include "Shapes.h"

#include <fcntl.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <pthread.h>
#include <sched.h>
#include <sys/personality.h>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

namespace puppets {
namespace {

void share(const char* path, std::size_t written) {
    const int file = open(path, O_RDWR);
    const off_t size = lseek(file, 0, SEEK_END);
    if (file < 0 || size <= 0) {
        fail(path);
    }
    const std::size_t pages = static_cast<std::size_t>(size) / page;
    char* m = map(pages * page, readWrite, MAP_SHARED, file);
    if (written != 0) {
        write(m, 0, written);
    } else {
        touch(m, 0, pages);
    }
    tell("shared", m, pages, figure("dirty", written == 0 ? pages : written));
}

void big(std::size_t mebibytes) {
    char* m = anonymous(mebibytes * 256);
    write(m, 0, mebibytes * 256);
    tell("big", m, mebibytes * 256, figure("dirty", mebibytes * 256));
}

void manyMappings(std::size_t count) {
    char* m = map(count * page, PROT_NONE, privateAnonymous);
    for (std::size_t i = 0; i < count; i += 2) { // every second page has other rights: one mapping each
        mprotect(m + i * page, page, readWrite);
        write(m, i, 1);
    }
    tell("many", m, count, figure("dirty", (count + 1) / 2));
}

/// `pause` in microseconds, as the threads of a program wait for work.
[[noreturn]] void churnForever(useconds_t pause) {
    for (std::size_t round = 0;; ++round) {
        char* m = map((64 + round % 64) * page, readWrite, privateAnonymous);
        write(m, 0, 32);
        munmap(m + 16 * page, 8 * page);
        if (pause != 0) {
            usleep(pause);
        }
        munmap(m, (64 + round % 64) * page);
    }
}

void churn(std::size_t moreThreads) {
    const auto start = [](void*) -> void* { churnForever(20'000); };
    alarm(120);
    pthread_t thread{};
    for (std::size_t i = 0; i < moreThreads; ++i) {
        pthread_create(&thread, nullptr, start, nullptr);
    }
    std::printf("ready\n");
    std::fflush(stdout);
    churnForever(moreThreads == 0 ? 0 : 20'000);
}

/// Loads the same program again and again, from another thread than the first.
void reload(char** arguments) {
    const auto wait = [](void*) -> void* {
        for (;;) {
            pause();
        }
    };
    const auto load = [](void* words) -> void* {
        usleep(static_cast<useconds_t>(std::clock() * 7919 % 3000));
        execv("/proc/self/exe", static_cast<char**>(words));
        fail("exec");
    };
    signal(SIGPIPE, SIG_IGN); // whoever started it hears it once
    std::printf("ready\n");
    std::fflush(stdout);
    alarm(120);
    pthread_t thread{};
    for (int i = 0; i < 60; ++i) {
        pthread_create(&thread, nullptr, wait, nullptr);
    }
    pthread_create(&thread, nullptr, load, arguments);
    wait(nullptr);
}

[[noreturn]] void breathe() {
    std::printf("ready\n");
    std::fflush(stdout);
    alarm(120);
    signal(SIGCHLD, SIG_IGN); // children leave nothing behind
    for (std::size_t round = 0;; ++round) {
        const std::size_t pages = 16 + round * 7919 % 1000;
        char* m = map(pages * page, readWrite, privateAnonymous);
        write(m, 0, pages);
        if (round % 16 == 0 && fork() == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            write(m, 0, pages / 2);
            usleep(250'000);
            _exit(0);
        }
        usleep(20'000);
        munmap(m, pages * page);
    }
}

void halfTouchedMemory(std::size_t pages) {
    const int file = makeMemfd("half", pages);
    char* m = map(pages * page, readWrite, MAP_SHARED, file);
    write(m, 0, pages);
    munmap(m, pages * page);
    m = map(pages * page, readWrite, MAP_SHARED, file);
    touch(m, 0, pages / 2);
    tell("half-touched", m, pages, "");
}

void twins() {
    char* m = anonymous(64);
    write(m, 0, 64);
    tell("twins", m, 64, figure("dirty", 64));
    static char stack[65536];
    static const pid_t parent = getpid();
    const auto wait = [](void*) -> int {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        while (getppid() == parent) { // on a busy machine it has ended before
            pause();
        }
        return 0;
    };
    std::printf("child 0 %d\n", clone(wait, stack + sizeof(stack), CLONE_VM | SIGCHLD, nullptr));
}

void leaderless() {
    const auto rest = [](void*) -> void* {
        char* m = anonymous(32);
        write(m, 0, 32);
        tell("after-the-leader", m, 32, figure("dirty", 32));
        usleep(20'000); // the first thread is gone by then
        holdStill();
        std::_Exit(0);
    };
    pthread_t thread{};
    pthread_create(&thread, nullptr, rest, nullptr);
    pthread_exit(nullptr);
}

/// Answers every ioctl with the request `number`, or every system call of that number where it is a small one
/// (0 is ptrace), by `error`, here and in what is run from here.
void refuse(std::uint32_t number, std::uint32_t error) {
    constexpr std::uint32_t mostCalls = 4096;
    const bool isCall = number < mostCalls;
    const std::uint32_t call = !isCall ? SYS_ioctl : number == 0 ? SYS_ptrace : number;
    const std::uint32_t place = isCall ? offsetof(seccomp_data, nr) : offsetof(seccomp_data, args[1]);
    sock_filter filter[] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, call, 0, 3),
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, place),
        BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, isCall ? call : number, 0, 1),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | error),
        BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
    };
    const sock_fprog program{std::size(filter), filter};
    if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 ||
        prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) != 0) {
        fail("seccomp");
    }
}

} // namespace
} // namespace puppets

int main(int argc, char** argv) {
    using namespace puppets;
    const std::string what = argc > 1 ? argv[1] : "";
    const auto number = [&](int at) { return at < argc ? std::strtoul(argv[at], nullptr, 0) : 0UL; };
    if (what == "refuse" && argc > 3) {
        if (std::string(argv[2]) == "fixed") {
            personality(ADDR_NO_RANDOMIZE);
        } else {
            char* error = nullptr; // NUMBER or NUMBER:ERROR
            const auto refused = static_cast<std::uint32_t>(std::strtoul(argv[2], &error, 0));
            const bool isGiven = *error == ':';
            refuse(refused,
                   isGiven ? static_cast<std::uint32_t>(std::strtoul(error + 1, nullptr, 0)) : EPERM);
        }
        execv(argv[3], argv + 3);
        fail(argv[3]);
    }
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    alarm(600);
    if (what == "zoo") {
        zoo();
    } else if (what == "share" && argc > 2) {
        share(argv[2], 0);
    } else if (what == "fill" && argc > 3) {
        share(argv[2], number(3));
    } else if (what == "big") {
        big(number(2));
    } else if (what == "maps") {
        manyMappings(number(2));
    } else if (what == "churn") {
        churn(number(2));
    } else if (what == "breathe") {
        breathe();
    } else if (what == "family" && argc > 4) {
        family(number(2), number(3), argv[4]);
    } else if (what == "memory") {
        halfTouchedMemory(number(2));
    } else if (what == "reload") {
        reload(argv);
    } else if (what == "twins") {
        twins();
    } else if (what == "leaderless") {
        leaderless();
    } else if (what != "idle") {
        std::fprintf(stderr, "puppet: do not know '%s'\n", what.c_str());
        return 2;
    }
    holdStill();
}
