// IntegerTable: a hash table with raw 64-bit keys.
//
// Keys are object ids or cache offsets, whose low byte says little: the hash drops it.

#pragma once

#include <cstdint>
#include <unordered_map>

namespace tally {

struct IntegerKeyHash {
    std::size_t operator()(std::uint64_t key) const { return key >> 8; }
};

template <typename Value>
using IntegerTable = std::unordered_map<std::uint64_t, Value, IntegerKeyHash>;

} // namespace tally
