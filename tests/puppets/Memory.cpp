#include "Memory.h"

#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace puppets {

[[noreturn]] void fail(const char* what) {
    std::fprintf(stderr, "puppet: %s: %s\n", what, std::strerror(errno));
    std::exit(2);
}

char* map(std::size_t size, int protection, int flags, int file, off_t offset) {
    void* address = mmap(nullptr, size, protection, flags, file, offset);
    if (address == MAP_FAILED) {
        fail("mmap");
    }
    return static_cast<char*>(address);
}

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

char* anonymous(std::size_t pages) {
    char* address = map((pages + 2) * page, PROT_NONE, privateAnonymous) + page;
    mprotect(address, pages * page, readWrite);
    madvise(address, pages * page, MADV_NOHUGEPAGE);
    return address;
}

} // namespace puppets
