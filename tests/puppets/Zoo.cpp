#include "Memory.h"
#include "Shapes.h"

#include <fcntl.h>
#include <linux/io_uring.h>
#include <linux/userfaultfd.h>
#include <sys/ioctl.h>
#include <sys/ipc.h>
#include <sys/shm.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#ifndef MADV_GUARD_INSTALL
#define MADV_GUARD_INSTALL 102
#endif

namespace puppets {

namespace {

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
        std::uint64_t entry = 0; // old kernels show no page of their own there
        pread(open("/proc/self/pagemap", O_RDONLY | O_CLOEXEC), &entry, sizeof entry,
              static_cast<off_t>(reinterpret_cast<std::uintptr_t>(m) / page * sizeof entry));
        tell("ring", m, 1, figure("dirty", entry >> 63));
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

} // namespace

void zoo() {
    zooOfAnonymousMemory();
    zooOfFiles();
    zooOfSharedMemory();
}

} // namespace puppets
