// TLRangeSizes: what a range, a region, an object or a row holds. A new kind of memory begins here.

#pragma once

#include <cstdint>

namespace tally {

/// Bytes.
struct TLRangeSizes {
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::uint64_t clean = 0;
    std::uint64_t reclaimable = 0;
    std::uint64_t wired = 0;

    /// What cannot be had back without losing it: in memory or in swap.
    std::uint64_t charged() const { return dirty + swapped; }
    TLRangeSizes& operator+=(const TLRangeSizes& other) {
        dirty += other.dirty;
        swapped += other.swapped;
        clean += other.clean;
        reclaimable += other.reclaimable;
        wired += other.wired;
        return *this;
    }
    friend bool operator==(const TLRangeSizes&, const TLRangeSizes&) = default;
};

} // namespace tally
