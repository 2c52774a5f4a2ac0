#include "Memory.h"
#include "Shapes.h"

#include <pthread.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <string>

namespace puppets {

namespace {

/// Whether child `child` of a "random" family writes page `at` of its memory.
bool isDrawn(std::size_t child, std::size_t at) {
    std::uint64_t x = (child * 1'000'003 + at) * 0x9e3779b97f4a7c15U;
    x = (x ^ x >> 30) * 0xbf58476d1ce4e5b9U;
    return (x ^ x >> 31) % 10 < 3;
}

void change(char* m, std::size_t pages, const std::string& how, std::size_t child) {
    for (std::size_t i = 0; i < pages; ++i) {
        const bool writes = how == "half"     ? i % 2 == 0
                            : how == "random" ? isDrawn(child, i)
                                              : how == "huge" && i % 512 == 0;
        if (writes) {
            write(m, i, 1);
        }
    }
    if (how == "drop") {
        munmap(m + pages / 2 * page, pages / 2 * page);
    } else if (how == "grow") {
        write(map(64 * page, readWrite, privateAnonymous), 0,
              64); // lies next to what is there, or is merged with it
    }
}

/// Tells the parent through `pipe` that this child is ready, and waits.
void* sayReady(void* pipe) {
    usleep(gettid() == getpid() ? 0 : 20'000); // the first thread is gone by then
    static_cast<void>(::write(*static_cast<int*>(pipe), "x", 1));
    for (;;) {
        pause();
    }
}

/// Makes a private and a shared mapping of `tebibytes` TiB each, with `pages` pages all over them.
void reserve(std::size_t tebibytes, std::size_t pages) {
    const std::size_t size = tebibytes << 40;
    for (char* m : {map(size, readWrite, privateAnonymous | MAP_NORESERVE),
                    map(size, readWrite, MAP_SHARED | MAP_NORESERVE, makeMemfd("sparse", size / page))}) {
        for (std::size_t i = 0; i < pages; ++i) {
            write(m, size / page / pages * i, 1);
        }
    }
}

} // namespace

void family(std::size_t kids, std::size_t pages, const std::string& how) {
    char* m = how == "huge" ? map((pages + 512) * page, readWrite, privateAnonymous) : anonymous(pages);
    if (how == "huge") {
        m += (512 * page - reinterpret_cast<std::uintptr_t>(m) % (512 * page)) % (512 * page);
        madvise(m, pages * page, MADV_HUGEPAGE);
    }
    write(m, 0, pages);
    if (how.starts_with("reserve")) {
        reserve(std::stoul(how.substr(7)), pages);
    }
    if (how == "freed") {
        madvise(m, pages * page, MADV_FREE);
    }
    if (how == "swapped") {
        char* shared = map(pages * page, readWrite, MAP_SHARED | MAP_ANONYMOUS);
        write(shared, 0, pages);
        for (char* memory : {m, shared}) {
            madvise(memory, pages * page, MADV_PAGEOUT);
        }
    }
    static int ready[2];
    if (pipe(ready) != 0) {
        fail("pipe");
    }
    tell("family", m, pages, "");
    for (std::size_t child = 0; child < kids; ++child) {
        const int pid = fork();
        if (pid == 0) {
            prctl(PR_SET_PDEATHSIG, SIGKILL);
            alarm(600);
            change(m, pages, how, child);
            if (how == "leaderless") {
                pthread_t other{};
                pthread_create(&other, nullptr, sayReady, &ready[1]);
                pthread_exit(nullptr);
            }
            sayReady(&ready[1]);
        }
        std::printf("child 0 %d\n", pid);
    }
    for (std::size_t child = 0; child < kids; ++child) {
        char byte = 0;
        static_cast<void>(read(ready[0], &byte, 1));
    }
    if (how == "grow") {
        change(m, pages, how, kids);
    }
}

} // namespace puppets
