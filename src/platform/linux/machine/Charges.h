// What a process is charged for, from its status file.

#pragma once

#include "platform/linux/machine/ProcessStat.h"

#include <cstdint>
#include <optional>

namespace tally::platform {

/// What the page tables of a task show, in bytes; a page that is mapped twice counts twice.
struct ResidentMemory {
    std::uint64_t anonymous = 0;
    std::uint64_t shared = 0; // pages of shared memory
    std::uint64_t swapped = 0;
};

/// Bytes, all of one reading.
struct Charges {
    std::uint64_t pageTable = 0;
    std::uint64_t physTally = 0; // with the page tables
    std::uint64_t peak = 0;
    std::uint64_t residentAnonymous = 0;
};

/// The status of process `pid`; absent when it cannot be read, with errno.
/// @param counted what a walk has found that was just made: before 6.2 the kernel's counters lag behind it.
std::optional<ProcessStatus> readExactStatus(std::int32_t pid, const std::optional<ResidentMemory>& counted);

/// What a process with that status is charged for.
/// @param isSecondTenant of tasks that share one address space only the first is charged for its page tables.
Charges chargesOf(const ProcessStatus& status, bool isSecondTenant);

/// Both together.
std::optional<Charges> readCharges(std::int32_t pid, bool isSecondTenant,
                                   const std::optional<ResidentMemory>& counted);

} // namespace tally::platform
