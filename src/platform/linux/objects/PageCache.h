// What the page cache holds of a file.

#pragma once

#include "platform/linux/io/Descriptor.h"

#include <cstdint>
#include <optional>

namespace tally::platform {

/// Pages of a byte range of a file in the page cache.
struct CachedPages {
    std::uint64_t cached = 0;
    std::uint64_t dirty = 0;   // or being written back
    std::uint64_t evicted = 0; // for shared memory: swapped out
};

/// Asks for [offset, offset + length); a length of 0 is 0 pages. Absent on failure, with errno: before 6.5
/// the kernel has no such call, filters can forbid it, and it refuses hugetlb files.
std::optional<CachedPages> cachedPages(const Descriptor& file, std::uint64_t offset, std::uint64_t length);

/// The same, for shared memory also by older calls. To these a page is in memory as long as the kernel still
/// has it somewhere, though it is swapped out.
std::optional<CachedPages> cachedOrHeldPages(const Descriptor& file, std::uint64_t offset,
                                             std::uint64_t length);

} // namespace tally::platform
