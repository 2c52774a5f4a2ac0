// What a process is charged for.

#pragma once

#include "platform/linux/pieces/Piece.h"

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
/// @param counted what a walk has found that was just made: before 6.2 the kernel's counters lag behind it.
std::optional<Charges> readCharges(std::int32_t pid, bool isSecondTenant,
                                   const std::optional<ResidentMemory>& counted);

} // namespace tally::platform
