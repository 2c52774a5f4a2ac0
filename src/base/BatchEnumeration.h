// Batch enumeration: a long list is handed on in slices, so that what a slice needs for a moment is released
// before the next one.

#pragma once

#include <algorithm>
#include <cstddef>
#include <span>

namespace tally {

/// Calls `handler(slice)` with consecutive slices of `items`, none longer than `batchSize` (0 counts as 1).
/// The list must not change meanwhile.
template <typename T, typename Handler>
void tl_enumerateObjectsWithBatchSize(std::span<T> items, std::size_t batchSize, Handler&& handler) {
    const std::size_t step = std::max<std::size_t>(batchSize, 1);
    for (std::size_t at = 0; at < items.size(); at += step) {
        handler(items.subspan(at, std::min(step, items.size() - at)));
    }
}

} // namespace tally
