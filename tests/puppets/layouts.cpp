// A program that lays memory out as allocators, runtimes and threads do, or keeps a file open, says what it
// did, and holds still until its input closes.
//
//   layouts threads COUNT          stacks of COUNT threads, and a mapping that only lies as a stack does
//   layouts allocators             what the C library gives to malloc, and what only looks like it
//   layouts runtimes LIBRARY       maps the file LIBRARY, and memory where runtimes have theirs
//   layouts open PATH              a descriptor of PATH
//
// Lines of output are "name address bytes key=value ..."; "ready" ends the ledger. `tag` is the tag that the
// mapping at the address must have.

#include <fcntl.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

namespace {

using Word = volatile std::uint64_t;
constexpr std::size_t page = 4096;
constexpr std::size_t size = 64 * page;
constexpr std::uint64_t heapSize = 64 << 20;
constexpr std::size_t noGuard = 128 << 10; // inaccessible bytes, more than stacks have below them

void tell(const char* name, const volatile void* address, int tag) {
    std::printf("%s %zx 0 tag=%d\n", name, reinterpret_cast<std::uintptr_t>(address), tag);
}

/// Memory that no neighbour merges with, above `gap` inaccessible bytes, with two words at its start.
Word* memory(std::size_t gap, std::uint64_t first = 1, std::uint64_t second = 0) {
    void* address = mmap(nullptr, gap + size + page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    auto* inside = reinterpret_cast<Word*>(static_cast<char*>(address) + gap);
    mprotect(const_cast<std::uint64_t*>(inside), size, PROT_READ | PROT_WRITE);
    inside[0] = first;
    inside[1] = second;
    return inside;
}

Word* memoryAt(std::uint64_t address, int rights = PROT_WRITE) {
    constexpr int flags = MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED_NOREPLACE;
    return static_cast<Word*>(mmap(reinterpret_cast<void*>(address), size, rights, flags, -1, 0));
}

void startThread() {
    static volatile bool isReady;
    isReady = false;
    const auto body = [](void*) -> void* {
        const volatile char local = 0;
        tell("thread-stack", &local, 30);
        void* const allocated = std::malloc(1000); // in an arena of the thread's own
        tell("arena", static_cast<char*>(allocated) - reinterpret_cast<std::uintptr_t>(allocated) % heapSize,
             2);
        isReady = true;
        return pause(), nullptr;
    };
    pthread_t thread{};
    pthread_create(&thread, nullptr, body, nullptr);
    while (!isReady) {
        usleep(1000);
    }
}

void allocators() {
    const volatile char local = 0;
    tell("main-stack", &local, 30);
    tell("heap", std::malloc(64), 5);
    tell("large", static_cast<char*>(std::malloc(3 << 20)) - 16, 3);
    tell("chunk", memory(noGuard, 0, size | 2), 3);
    tell("chunk-and-smaller-rest", memory(noGuard, 0, (size - 8 * page) | 2), 3);
    tell("chunk-and-larger-rest", memory(noGuard, 0, (size / 4) | 2), 0);
    tell("first-word-set", memory(noGuard, 1, size | 2), 0);
    tell("not-marked-as-mapped", memory(noGuard, 0, size | 1), 0);
    tell("guard", memory(noGuard) - 1, 31);
    tell("no-thread-above-a-guard", memory(page), 0);
    Word* heap = memoryAt(0x100 * heapSize); // as an arena's, but with sizes that are not its mapping's
    heap[0] = 0x100 * heapSize + 0x30;
    heap[2] = 32 * page;
    heap[3] = 32 * page;
    tell("no-arena", heap, 0);
    Word* closed = memory(noGuard);
    mprotect(const_cast<std::uint64_t*>(closed), size, PROT_NONE);
    tell("inaccessible-with-a-page", closed, 0);
    Word* absent = memory(noGuard, 0, size | 2);
    absent[page / sizeof(Word)] = 1;
    madvise(const_cast<std::uint64_t*>(absent), page, MADV_DONTNEED);
    tell("first-page-absent", absent, 0); // the last: the test looks at its page
}

void runtimes(const std::string& library) {
    mmap(nullptr, page, PROT_READ, MAP_PRIVATE, open(library.c_str(), O_RDONLY), 0);
    const int java = library.ends_with("libjvm.so") ? 44 : 0;
    tell("go", memoryAt(0xc000000000), 105);
    tell("go-too", memoryAt(0xc000400000), 105);
    tell("above-go", memoryAt(0xc100000000 + page), 0);
    tell("java", memoryAt(0x600000000 + page), java);
    tell("aligned", memoryAt(0x900000000), library.ends_with("libjemalloc.so.2") ? 106 : 0);
    tell("generated-code", memoryAt(0xa00000000, PROT_EXEC), java != 0 ? java : 107);
}

} // namespace

int main(int, char** argv) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    alarm(600);
    const std::string what = argv[1];
    if (what == "threads") {
        for (int i = std::atoi(argv[2]); i > 0; --i) {
            startThread();
        }
        tell("like-a-stack", memory(page), 0);
    } else if (what == "allocators") {
        allocators();
    } else if (what == "runtimes") {
        runtimes(argv[2]);
    } else {
        open(argv[2], O_RDONLY);
    }
    std::puts("ready");
    std::fflush(stdout);
    return static_cast<int>(read(STDIN_FILENO, argv[0], 1));
}
