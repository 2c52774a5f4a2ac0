// The text of /proc/PID/maps and /proc/PID/smaps, decoded.

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <string_view>
#include <vector>

namespace tally::platform {

/// Decodes one line of maps, also the first of an entry of smaps. @return false when it is none.
bool decodeMapsLine(std::string_view line, Mapping* mapping);

/// Adds the mappings of the next lines of a maps file; what is not a mapping is passed over, and [vsyscall],
/// which is no memory of the process.
void decodeMaps(std::string_view lines, std::vector<Mapping>* mappings);

/// What smaps tells of one mapping, in bytes.
struct SmapsEntry {
    std::uint64_t start = 0;     // address
    std::uint64_t resident = 0;  // Rss
    std::uint64_t anonymous = 0; // Anonymous
    std::uint64_t swapped = 0;   // Swap
    std::uint64_t lazyFree = 0;  // LazyFree
    std::uint64_t dirty = 0;     // Shared_Dirty + Private_Dirty
    std::uint64_t hugetlb = 0;   // Shared_Hugetlb + Private_Hugetlb
    bool locked = false;         // VmFlags "lo"
};

/// Adds what the next lines of a smaps file tell.
void decodeSmaps(std::string_view lines, std::vector<SmapsEntry>* entries);

/// LazyFree of a smaps_rollup file, in bytes.
std::uint64_t decodeRollupLazyFree(std::string_view text);

} // namespace tally::platform
