// Rounding of addresses and offsets to pages, whose size is a power of two.

#pragma once

#include <cstdint>

namespace tally {

constexpr std::uint64_t roundDownToPage(std::uint64_t value, std::uint64_t pageSize) {
    return value & ~(pageSize - 1);
}

constexpr std::uint64_t roundUpToPage(std::uint64_t value, std::uint64_t pageSize) {
    return roundDownToPage(value + pageSize - 1, pageSize);
}

} // namespace tally
