// The text of /proc/PID/maps and /proc/PID/smaps, decoded.

#pragma once

#include "platform/linux/walk/Mapping.h"

#include <cstdint>
#include <string_view>
#include <vector>

namespace tally::platform {

/// Decodes one line of maps, also the first of an entry of smaps. @return false when it is none.
bool decodeMapsLine(std::string_view line, Mapping* mapping);

/// Decodes a maps file; what is not a mapping is passed over, and [vsyscall], which is no memory of the
/// process.
std::vector<Mapping> decodeMaps(std::string_view text);

/// What smaps tells of one mapping, in bytes.
struct SmapsEntry {
    Mapping mapping;
    std::uint64_t resident = 0;  // Rss
    std::uint64_t anonymous = 0; // Anonymous
    std::uint64_t swapped = 0;   // Swap
    std::uint64_t lazyFree = 0;  // LazyFree
    std::uint64_t dirty = 0;     // Shared_Dirty + Private_Dirty
    std::uint64_t hugetlb = 0;   // Shared_Hugetlb + Private_Hugetlb
    bool locked = false;         // VmFlags "lo"
};

std::vector<SmapsEntry> decodeSmaps(std::string_view text);

/// LazyFree of a smaps_rollup file, in bytes.
std::uint64_t decodeRollupLazyFree(std::string_view text);

} // namespace tally::platform
