// SysV shared memory segments, which live without being attached.

#pragma once

#include <cstdint>
#include <string_view>
#include <vector>

namespace tally::platform {

struct SysVSegment {
    std::uint64_t id = 0;
    std::int32_t creator = 0; // pid
    std::int64_t changed = 0; // seconds since 1970: its making, or a later change of its rights
    // Bytes.
    std::uint64_t size = 0;
    std::uint64_t resident = 0;
    std::uint64_t swapped = 0;
};

/// Decodes /proc/sysvipc/shm; lines that are no segment are passed over.
std::vector<SysVSegment> decodeSysVSegments(std::string_view text);

} // namespace tally::platform
