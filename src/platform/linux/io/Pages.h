// The machine's page, and ranges of addresses.

#pragma once

#include <unistd.h>

#include <cstdint>

namespace tally::platform {

/// The machine's page, bytes: page states and counts are in these.
inline const std::uint64_t basePage = static_cast<std::uint64_t>(sysconf(_SC_PAGESIZE));

/// `bytes`, rounded up to whole pages.
inline std::uint64_t wholePages(std::uint64_t bytes) { return (bytes + basePage - 1) / basePage * basePage; }

/// [start, end) of addresses.
struct AddressRange {
    std::uint64_t start = 0;
    std::uint64_t end = 0;
};

} // namespace tally::platform
