// A program that lays memory out as allocators, runtimes and threads do, or keeps memory by descriptors, says
// what it did, and holds still until its input closes.
//
//   layouts threads COUNT          stacks of COUNT threads, and a mapping that only lies as a stack does
//   layouts allocators             what the C library gives to malloc, and what only looks like it
//   layouts runtimes LIBRARY       maps the file LIBRARY, and memory where runtimes have theirs
//   layouts hold                   descriptors of every kind
//   layouts open PATH              a descriptor of PATH
//
// Lines of output are "name address bytes key=value ..."; "ready" ends the ledger. `tag` is the tag that the
// mapping at the address must have. Of what is held, the address is the number of its inode.

#include <fcntl.h>
#include <linux/bpf.h>
#include <pthread.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

namespace {

using Word = volatile std::uint64_t;
constexpr std::size_t page = 4096;
constexpr std::uint64_t heapSize = 64 << 20;
constexpr std::size_t noGuard = 128 << 10; // inaccessible bytes, more than stacks have below them

void tell(const char* name, std::uint64_t address, std::size_t bytes, const std::string& figures) {
    std::printf("%s %llx %zu %s\n", name, static_cast<unsigned long long>(address), bytes, figures.c_str());
}

void tellTag(const char* name, const volatile void* address, int tag) {
    tell(name, reinterpret_cast<std::uintptr_t>(address), 0, "tag=" + std::to_string(tag));
}

/// Memory that no neighbour merges with, above `gap` inaccessible bytes, with two words at its start.
Word* memory(std::size_t size, std::size_t gap, std::uint64_t first = 1, std::uint64_t second = 0) {
    void* address = mmap(nullptr, gap + size + page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    Word* inside = reinterpret_cast<Word*>(static_cast<char*>(address) + gap);
    mprotect(const_cast<std::uint64_t*>(inside), size, PROT_READ | PROT_WRITE);
    inside[0] = first;
    inside[1] = second;
    return inside;
}

void startThread() {
    static void* volatile allocated = nullptr;
    pthread_t thread{};
    const auto body = [](void*) -> void* {
        allocated = std::malloc(1000); // in an arena of the thread's own
        pause();
        return nullptr;
    };
    allocated = nullptr;
    pthread_create(&thread, nullptr, body, nullptr);
    while (allocated == nullptr) {
        usleep(1000);
    }
    pthread_attr_t attributes;
    void* stack = nullptr;
    std::size_t size = 0;
    pthread_getattr_np(thread, &attributes);
    pthread_attr_getstack(&attributes, &stack, &size);
    tellTag("thread-stack", stack, 30);
    tellTag("guard", static_cast<char*>(stack) - page, 31);
    tellTag("arena", reinterpret_cast<void*>(reinterpret_cast<std::uintptr_t>(allocated) & ~(heapSize - 1)),
            2);
}

void allocators() {
    const char local = 0;
    constexpr std::size_t size = 64 * page;
    tellTag("main-stack", &local, 30);
    tellTag("heap", std::malloc(64), 5);
    tellTag("large", static_cast<char*>(std::malloc(3 << 20)) - 16, 3);
    tellTag("chunk", memory(size, noGuard, 0, size | 2), 3);
    tellTag("chunk-and-smaller-rest", memory(size, noGuard, 0, (size - 8 * page) | 2), 3);
    tellTag("chunk-and-larger-rest", memory(size, noGuard, 0, (size / 4) | 2), 0);
    tellTag("first-word-set", memory(size, noGuard, 1, size | 2), 0);
    tellTag("longer-than-its-mapping", memory(size, noGuard, 0, 2 * size | 2), 0);
    tellTag("not-marked-as-mapped", memory(size, noGuard, 0, size | 1), 0);
    tellTag("no-thread-above-a-guard", memory(size, page), 0);
    // The header of a heap, where one can be, but with sizes that are not its mapping's.
    auto* words =
        reinterpret_cast<Word*>(mmap(reinterpret_cast<void*>(0x100 * heapSize), size, PROT_READ | PROT_WRITE,
                                     MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED_NOREPLACE, -1, 0));
    words[0] = 0x100 * heapSize + 0x30;
    words[2] = 32 * page;
    words[3] = 32 * page;
    tellTag("no-arena", words, 0);
    Word* closed = memory(page, noGuard);
    mprotect(const_cast<std::uint64_t*>(closed), page, PROT_NONE);
    tellTag("inaccessible-with-a-page", closed, 0);
    Word* absent = memory(size, noGuard, 0, size | 2);
    absent[page / sizeof(Word)] = 1;
    madvise(const_cast<std::uint64_t*>(absent), page, MADV_DONTNEED);
    tellTag("first-page-absent", absent, 0); // the last: the test looks at its page
}

void runtimes(const std::string& library) {
    mmap(nullptr, page, PROT_READ, MAP_PRIVATE, open(library.c_str(), O_RDONLY), 0);
    const int java = library.ends_with("libjvm.so") ? 44 : 0;
    const int jemalloc = library.ends_with("libjemalloc.so.2") ? 106 : 0;
    const auto memoryAt = [](const char* name, std::uint64_t address, int tag, int rights = PROT_WRITE) {
        tellTag(name,
                mmap(reinterpret_cast<void*>(address), page, rights | PROT_READ,
                     MAP_PRIVATE | MAP_ANONYMOUS | MAP_FIXED_NOREPLACE, -1, 0),
                tag);
    };
    memoryAt("go", 0xc000000000, 105);
    memoryAt("go-too", 0xc000400000, 105);
    memoryAt("above-go", 0xc100000000 + page, 0);
    memoryAt("java", 0x600000000 + page, java);
    memoryAt("aligned", 0x900000000, jemalloc);
    memoryAt("generated-code", 0x900001000 + page, java != 0 ? java : 64, PROT_EXEC);
}

/// Writes the first `pages` of the file and tells of it.
void keep(const char* name, int file, std::size_t size, std::size_t pages, const char* listed) {
    ftruncate(file, static_cast<off_t>(size));
    for (std::size_t i = 0; i < pages; ++i) {
        pwrite(file, name, 1, static_cast<off_t>(i * page));
    }
    struct stat status {};
    fstat(file, &status);
    tell(name, status.st_ino, pages * page, "size=" + std::to_string(size) + " listed=" + listed);
}

int deletedFile(std::string path) {
    const int file = mkstemp(path.data());
    unlink(path.c_str());
    return file;
}

void hold() {
    const int memfd = memfd_create("held", 0);
    keep("memfd", memfd, 16 * page, 12, "yes");
    dup(memfd);
    const int mapped = memfd_create("mapped", 0);
    keep("mapped", mapped, 8 * page, 5, "no");
    mmap(nullptr, page, PROT_READ, MAP_SHARED, mapped, 0);
    keep("empty", memfd_create("empty", 0), 8 * page, 0, "no");
    keep("sparse", memfd_create("sparse", 0), 1UL << 40, 1, "yes");
    keep("deleted", deletedFile("/dev/shm/layouts-XXXXXX"), 9 * page, 9, "yes");
    keep("on-disk", deletedFile("/var/tmp/layouts-XXXXXX"), 11 * page, 11, "no");
    const int huge = memfd_create("huge", MFD_HUGETLB);
    if (huge >= 0 && fallocate(huge, 0, 0, 2 << 20) == 0) {
        tell("huge", 0, 2 << 20, "size=2097152 listed=yes wired=2097152");
    }
    open("/dev/null", O_RDONLY);
    mkfifo("fifo", 0600);
    open("fifo", O_RDWR);
    const int segment = shmget(IPC_PRIVATE, 20 * page, 0600 | IPC_CREAT);
    char* m = static_cast<char*>(shmat(segment, nullptr, 0));
    m[0] = m[5 * page] = 1;
    shmdt(m);
    tell("segment", static_cast<std::uint64_t>(segment), 2 * page, "size=81920 listed=yes");
    bpf_attr map{};
    map.map_type = BPF_MAP_TYPE_ARRAY;
    map.key_size = 4;
    map.value_size = 64;
    map.max_entries = 512;
    if (syscall(SYS_bpf, BPF_MAP_CREATE, &map, sizeof map) >= 0) {
        tell("bpf", 0, 0, "");
    }
}

} // namespace

int main(int argc, char** argv) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    alarm(600);
    const std::string what = argv[1];
    const std::string argument = argc > 2 ? argv[2] : "";
    if (what == "threads") {
        for (int i = std::stoi(argument); i > 0; --i) {
            startThread();
        }
        tellTag("like-a-stack", memory(page, page), 0);
    } else if (what == "allocators") {
        allocators();
    } else if (what == "runtimes") {
        runtimes(argument);
    } else if (what == "hold") {
        hold();
    } else {
        open(argument.c_str(), O_RDONLY);
    }
    std::puts("ready");
    std::fflush(stdout);
    return static_cast<int>(read(STDIN_FILENO, argv[0], 1));
}
