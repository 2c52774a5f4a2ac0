// What a process is charged for.

#pragma once

#include <cstdint>
#include <optional>

namespace tally::platform {

/// Bytes, all of one reading.
struct Charges {
    std::uint64_t pageTable = 0;
    std::uint64_t physTally = 0; // with the page tables
    std::uint64_t peak = 0;
    std::uint64_t residentAnonymous = 0;
};

/// Reads what process `pid` is charged for; absent when that fails, with errno.
/// @param isSecondTenant of tasks that share one address space only the first is charged for its page tables.
std::optional<Charges> readCharges(std::int32_t pid, bool isSecondTenant);

} // namespace tally::platform
