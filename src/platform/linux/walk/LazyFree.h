// Which processes can have lazily freed memory: only reading smaps tells, so as few as possible are asked.
//
// The machine's counters tell how much there is in all. In a gather the measured processes are asked in
// falling order of their anonymous memory until that much was found. Thread-safe.

#pragma once

#include <cstdint>
#include <string>

namespace tally::platform {

/// Whether process `pid` has lazily freed memory.
/// @param folder where its files are.
bool hasLazilyFreedMemory(std::int32_t pid, const std::string& folder);

} // namespace tally::platform
