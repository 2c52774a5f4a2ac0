// Piece: what the walk reports as one mapping: a mapping, or the part of one that stands behind one object.
//
// Addresses of pieces inside a mapping are nominal: pieces lie side by side, each as long as the task holds
// pages of its object there. Their ends taken together, their sizes and their objects are exact.

#pragma once

#include "platform/mach_vm.h"

#include <cstddef>
#include <cstdint>

namespace tally::platform {

struct Piece {
    std::uint64_t start = 0;
    std::uint64_t size = 0; // bytes
    std::uint64_t offset = 0;
    std::uint64_t objectId = 0; // 0: nothing resident or swapped
    // Pages.
    std::uint32_t resident = 0;
    std::uint32_t dirty = 0;
    std::uint32_t reusable = 0;
    std::uint32_t swapped = 0;
    std::uint32_t tag = 0;
    std::int32_t protection = 0; // 1 read, 2 write, 4 execute
    std::uint8_t shareMode = SM_EMPTY;
    bool externalPager = false;
    bool isWired = false;
    std::size_t mapping = 0;    // index
    std::size_t firstWords = 0; // slice of the walk's page words; without one the pages stand in the order of
    std::size_t wordsCount = 0; // the counts: dirty, clean, reusable, swapped

    std::uint64_t end() const { return start + size; }
};

/// Dispositions of consecutive pages; page numbers count from the start of the piece.
struct PageWords {
    std::uint64_t firstPage = 0;
    std::uint32_t pages = 0;
    std::int32_t word = 0; // VM_PAGE_QUERY_...
};

} // namespace tally::platform
