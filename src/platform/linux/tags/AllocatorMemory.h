// Memory of the C library's allocator, told by what stands at the start of a mapping.
//
// Arenas: a heap of an arena begins at a multiple of 64 MiB with the address of its arena, the heap before it
// and its sizes. Large allocations: a mapped chunk begins with a word that is 0 and its size, and ends where
// the next begins. Both are checked against the mapping, so that other memory is hardly ever taken for one.
// Cost: two short reads a candidate, and only where pages are present; of a process with very many candidates
// the first are looked at.

#pragma once

#include "platform/linux/pages/Mapping.h"
#include "platform/linux/pages/PageStates.h"

#include <cstdint>
#include <span>
#include <string>

namespace tally::platform {

/// Tags the mappings of the process folder `folder` that are arenas or large allocations and untagged as yet.
void tagAllocatorMemory(const std::string& folder, std::span<const Mapping> mappings,
                        const PageStates& states, std::span<std::uint32_t> tags);

} // namespace tally::platform
