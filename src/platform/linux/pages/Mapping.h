// Mapping: one line of a process's address space, as the kernel lists it.

#pragma once

#include "platform/linux/io/Pages.h"

#include <cstdint>
#include <string>

namespace tally::platform {

struct Mapping {
    std::uint64_t start = 0;
    std::uint64_t end = 0;
    std::uint64_t fileOffset = 0; // bytes
    std::uint64_t inode = 0;
    std::uint32_t deviceMajor = 0;
    std::uint32_t deviceMinor = 0;
    bool readable = false;
    bool writable = false;
    bool executable = false;
    bool shared = false;
    std::uint64_t pageSize = 0; // bytes, above basePage for hugetlb; 0 where the source does not tell
    std::string name;           // path, or "[heap]" and the like; empty for plain anonymous memory

    std::uint64_t size() const { return end - start; }
    std::uint64_t device() const { return std::uint64_t{deviceMajor} << 32 | deviceMinor; }
    std::uint64_t pages() const { return size() / basePage; }
    bool isFileBacked() const { return inode != 0 || deviceMajor != 0 || deviceMinor != 0; }
    /// "[heap]", "[stack]" and named anonymous memory are memory of the process; other bracketed names are
    /// the kernel's own pages.
    bool isKernelSpecial() const {
        return !isFileBacked() && name.size() > 1 && name[0] == '[' && name != "[heap]" &&
               name != "[stack]" && !name.starts_with("[anon:") && !name.starts_with("[stack:");
    }
    /// Whether it can hold pages of the task's own, which relatives may share after a fork.
    bool isPrivate() const { return !shared && !isKernelSpecial(); }
    /// Memory that the kernel keeps on its own tmpfs, 00:01: memfds, SysV segments, shared anonymous memory.
    bool isSharedMemory() const { return shared && deviceMajor == 0 && deviceMinor == 1; }
    bool isPrivateAnonymous() const { return !isFileBacked() && isPrivate(); }
};

} // namespace tally::platform
