// PAGEMAP_SCAN, the kernel's query for runs of pages of one state (6.7 and later).

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <array>
#include <cstdint>
#include <span>

namespace tally::platform {

/// As the kernel lays it out (struct page_region of include/uapi/linux/fs.h); the installed headers are
/// older.
struct PageRegion {
    std::uint64_t start; // addresses
    std::uint64_t end;
    std::uint64_t categories;
};

inline constexpr std::uint64_t pageIsFile = 4;
inline constexpr std::uint64_t pageIsPresent = 8;
inline constexpr std::uint64_t pageIsSwapped = 16;
inline constexpr std::uint64_t pageIsZero = 32; // the kernel's zero page: no memory of its own
inline constexpr std::uint64_t pageIsHuge = 64; // mapped as one page, by an entry one level up
inline constexpr std::uint64_t pageIsGuard = 256;

/// Which runs one call gave, and how far it came.
struct PageScanStep {
    std::span<const PageRegion> regions; // in the room that the caller gave
    std::uint64_t pages = 0;             // in all regions
    std::uint64_t resume = 0;            // address at which to go on
};

/// Room for the runs of one call.
using PageScanRoom = std::array<PageRegion, 512>;

/// Pages that one call looks at most: the target's own calls that change its address space wait for it.
inline const std::uint64_t mostPagesOfCall = (64 << 20) / basePage;

/// Scans `range` for present and swapped pages, at most `mostPages` of them. Lets others in that wait for the
/// address space after as many as a call may look at. What is absent costs next to nothing, but for page
/// tables that were emptied.
/// @param withFile whether to tell file pages from others, which costs the kernel twice the time.
/// @return 0, or the error: ESRCH when the task has ended, ENOTTY when this kernel has no such query.
int scanPages(int pagemap, AddressRange range, bool withFile, std::uint64_t mostPages,
              std::span<PageRegion> room, PageScanStep* step);

} // namespace tally::platform
