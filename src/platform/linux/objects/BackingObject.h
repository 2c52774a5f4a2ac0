// What stands behind a mapping, and how it is told from others.

#pragma once

#include <cstdint>

namespace tally::platform {

enum class Backing : std::uint8_t {
    anonymous,    // private memory of the task
    special,      // the kernel's own pages: [vdso], [vvar]
    sharedMemory, // tmpfs files, named or deleted, memfd, SysV segments, shared anonymous memory
    hugetlb,      // pages of the hugetlb pool
    file,         // any other regular file
    device,       // a device's memory, or what a driver shows
};

/// What a mapping shows, and how its object is told from others.
struct BackingObject {
    Backing backing = Backing::anonymous;
    bool hasName = false; // a file that a path leads, or led, to
    std::uint64_t device = 0;
    std::uint64_t inode = 0;
    bool isSysV = false; // SysV segments and memfds share one numbering
};

} // namespace tally::platform
