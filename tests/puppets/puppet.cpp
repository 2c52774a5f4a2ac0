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
//   puppet refuse NUMBER COMMAND   runs COMMAND with every ioctl of that request number answered by EPERM, of
//   a
//                                  small number the system call, for number 0 ptrace; "NUMBER:ERROR" by
//                                  another error; "fixed" in place of a number runs it without randomised
//                                  addresses
//
// Every line of output is "name address bytes key=bytes ...", what the mapping must show; "ready" ends the
// ledger.

#include <fcntl.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/io_uring.h>
#include <linux/seccomp.h>
#include <linux/userfaultfd.h>
#include <pthread.h>
#include <sched.h>
#include <sys/ioctl.h>
#include <sys/ipc.h>
#include <sys/mman.h>
#include <sys/personality.h>
#include <sys/prctl.h>
#include <sys/shm.h>
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

#ifndef MADV_GUARD_INSTALL
#define MADV_GUARD_INSTALL 102
#endif

namespace {

constexpr std::size_t page = 4096;

[[noreturn]] void fail(const char* what) {
    std::fprintf(stderr, "puppet: %s: %s\n", what, std::strerror(errno));
    std::exit(2);
}

char* map(std::size_t size, int protection, int flags, int file = -1, off_t offset = 0) {
    void* address = mmap(nullptr, size, protection, flags, file, offset);
    if (address == MAP_FAILED) {
        fail("mmap");
    }
    return static_cast<char*>(address);
}

/// Writes pages [first, first + count), each with contents of its own.
void write(char* address, std::size_t first, std::size_t count) {
    for (std::size_t i = first; i < first + count; ++i) {
        *reinterpret_cast<volatile std::uint64_t*>(address + i * page) =
            (i + 1) * 0x9e3779b97f4a7c15U + getpid();
    }
}

void touch(const char* address, std::size_t first, std::size_t count) {
    for (std::size_t i = first; i < first + count; ++i) {
        static_cast<void>(*static_cast<const volatile char*>(address + i * page));
    }
}

void tell(const char* name, const void* address, std::size_t pages, const std::string& figures) {
    std::printf("%s %llx %zu %s\n", name,
                static_cast<unsigned long long>(reinterpret_cast<std::uintptr_t>(address)), pages * page,
                figures.c_str());
}

std::string figure(const char* key, std::size_t pages) {
    return std::string(key) + "=" + std::to_string(pages * page);
}

/// Says that the ledger is complete and waits until the input closes.
void holdStill() {
    std::printf("ready\n");
    std::fflush(stdout);
    char byte = 0;
    while (read(STDIN_FILENO, &byte, 1) > 0) {
    }
}

int makeFile(std::size_t pages) {
    std::string path = "puppet-XXXXXX";
    const int file = mkstemp(path.data());
    if (file < 0) {
        fail("mkstemp");
    }
    unlink(path.c_str());
    const std::string bytes(page, 'x');
    for (std::size_t i = 0; i < pages; ++i) {
        if (::write(file, bytes.data(), page) != static_cast<ssize_t>(page)) {
            fail("write");
        }
    }
    fsync(file); // clean from here on
    return file;
}

int makeMemfd(const char* name, std::size_t pages) {
    const int file = memfd_create(name, MFD_CLOEXEC);
    if (file < 0 || ftruncate(file, static_cast<off_t>(pages * page)) != 0) {
        fail("memfd");
    }
    return file;
}

constexpr int readWrite = PROT_READ | PROT_WRITE;
constexpr int privateAnonymous = MAP_PRIVATE | MAP_ANONYMOUS;

/// Private anonymous memory that no neighbour merges with: between two inaccessible pages.
char* anonymous(std::size_t pages) {
    char* address = map((pages + 2) * page, PROT_NONE, privateAnonymous) + page;
    mprotect(address, pages * page, readWrite);
    madvise(address, pages * page, MADV_NOHUGEPAGE);
    return address;
}

/// Has userfaultfd watch for writes to pages that were never touched: the kernel marks them, and there is no
/// memory. @return false where it cannot be done.
bool markUntouched(char* address, std::size_t pages) {
    constexpr std::uint64_t watchesUntouched = 1 << 13; // Linux 6.4
    const int faults = static_cast<int>(syscall(SYS_userfaultfd, O_CLOEXEC | UFFD_USER_MODE_ONLY));
    uffdio_api api{UFFD_API, watchesUntouched, 0};
    const uffdio_range range{reinterpret_cast<std::uintptr_t>(address), pages * page};
    uffdio_register watched{range, UFFDIO_REGISTER_MODE_WP, 0};
    uffdio_writeprotect mark{range, UFFDIO_WRITEPROTECT_MODE_WP};
    return ioctl(faults, UFFDIO_API, &api) == 0 && ioctl(faults, UFFDIO_REGISTER, &watched) == 0 &&
           ioctl(faults, UFFDIO_WRITEPROTECT, &mark) == 0;
}

void zooOfAnonymousMemory() {
    char* m = anonymous(64);
    write(m, 0, 40);
    tell("anonymous", m, 64, figure("dirty", 40));

    m = anonymous(32);
    tell("untouched", m, 32, "");

    m = anonymous(16);
    touch(m, 0, 16);
    tell("zero-pages", m, 16, "");

    m = anonymous(24);
    write(m, 0, 24);
    mprotect(m, 24 * page, PROT_NONE);
    tell("inaccessible-after-writing", m, 24, figure("dirty", 24));

    m = anonymous(20);
    write(m, 0, 20);
    if (mlock(m, 12 * page) == 0) {
        tell("locked", m, 12, figure("dirty", 12) + " " + figure("wired", 12));
    }

    m = anonymous(8);
    write(m, 0, 8);
    if (madvise(m + 2 * page, 4 * page, MADV_GUARD_INSTALL) == 0) { // drops the pages and marks them
        tell("guards", m, 8, figure("dirty", 4));
    }

    if (char* marked = anonymous(16); markUntouched(marked, 16)) {
        tell("marked-by-userfaultfd", marked, 16, figure("dirty", 0));
    }

    constexpr std::size_t hugePages = 512;
    m = map(3 * hugePages * page, readWrite, privateAnonymous);
    m += (hugePages * page - reinterpret_cast<std::uintptr_t>(m) % (hugePages * page)) % (hugePages * page);
    madvise(m, hugePages * page, MADV_HUGEPAGE);
    write(m, 0, 1);
    // What the kernel gave, one page or 512, only the kernel knows: the comparison with smaps covers it.

    m = anonymous(4096);
    write(m, 0, 4096);
    madvise(m, 4096 * page, MADV_FREE);
    tell("lazily-freed", m, 4096, "lazy-free=any"); // some pages can still wait on a processor's own list
}

void zooOfFiles() {
    const int file = makeFile(64);
    char* m = map(64 * page, PROT_READ, MAP_SHARED, file);
    touch(m, 0, 10);
    madvise(m, 64 * page, MADV_RANDOM);
    tell("file-shared-read", m, 64, "dirty=0 file=any");

    const int other = makeFile(48);
    m = map(48 * page, readWrite, MAP_PRIVATE, other);
    madvise(m, 48 * page, MADV_RANDOM);
    touch(m, 0, 48);
    write(m, 8, 5);
    write(m, 30, 1);
    tell("file-private-partly-copied", m, 48, figure("dirty", 6) + " " + figure("clean", 42));

    m = map(16 * page, readWrite, MAP_PRIVATE, other);
    write(m, 0, 16);
    tell("file-private-all-copied", m, 16, figure("dirty", 16) + " " + figure("clean", 0));

    const int third = makeFile(32);
    m = map(32 * page, readWrite, MAP_SHARED, third);
    touch(m, 0, 32);
    tell("file-shared-clean", m, 32, figure("dirty", 0) + " " + figure("clean", 32));

    const int locked = makeFile(12);
    m = map(12 * page, readWrite, MAP_PRIVATE, locked);
    write(m, 3, 2);
    if (mlock(m, 12 * page) == 0) {
        tell("file-private-locked", m, 12, "wired=any");
    }

    const int fourth = makeFile(0);
    ftruncate(fourth, 40 * page);
    m = map(40 * page, readWrite, MAP_SHARED, fourth);
    write(m, 4, 12);
    tell("file-shared-written", m, 40, "file=any");
}

void zooOfSharedMemory() {
    const int memfd = makeMemfd("zoo", 32);
    char* m = map(32 * page, readWrite, MAP_SHARED, memfd);
    write(m, 0, 20);
    tell("memfd", m, 32, "twice=any");
    char* again = map(16 * page, readWrite, MAP_SHARED, memfd, 8 * page);
    touch(again, 0, 16); // pages 8 to 23 of the object: 12 of them mapped above already, when that lies lower
    tell("memfd-again", again, 16, "twice=any");

    m = map(32 * page, readWrite, MAP_PRIVATE, makeMemfd("private", 32));
    touch(m, 0, 20);
    write(m, 4, 3);
    tell("memfd-private", m, 32, figure("dirty", 20));

    m = map(24 * page, readWrite, MAP_SHARED | MAP_ANONYMOUS);
    write(m, 2, 7);
    tell("shared-anonymous", m, 24, figure("dirty", 7));

    const int id = shmget(IPC_PRIVATE, 16 * page, 0600 | IPC_CREAT);
    if (id >= 0) {
        m = static_cast<char*>(shmat(id, nullptr, 0));
        shmctl(id, IPC_RMID, nullptr);
        write(m, 0, 9);
        tell("sysv", m, 16, figure("dirty", 9));
    }

    io_uring_params parameters{};
    const int ring = static_cast<int>(syscall(SYS_io_uring_setup, 8, &parameters));
    if (ring >= 0) { // else it is forbidden here
        m = map(page, readWrite, MAP_SHARED, ring);
        tell("ring", m, 1, figure("dirty", 1));
    }

    constexpr std::size_t hugePages = 512;
    for (const int flags : {MAP_PRIVATE, MAP_SHARED}) {
        void* huge =
            mmap(nullptr, 2 * hugePages * page, readWrite, flags | MAP_ANONYMOUS | MAP_HUGETLB, -1, 0);
        if (huge != MAP_FAILED) { // else this machine has no pool of huge pages
            m = static_cast<char*>(huge);
            write(m, 0, 1);
            const bool isPrivate = flags == MAP_PRIVATE;
            tell(isPrivate ? "hugetlb-private" : "hugetlb-shared", m, 2 * hugePages,
                 figure("dirty", hugePages) + " " + (isPrivate ? figure("wired", hugePages) : "shared=any"));
        }
    }
}

void zoo() {
    zooOfAnonymousMemory();
    zooOfFiles();
    zooOfSharedMemory();
}

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

int main(int argc, char** argv) {
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
