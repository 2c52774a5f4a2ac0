// The region walk: visits every mapping of a live task in rising address order.

#pragma once

#include "vm/RegionEnumeration.h"
#include "vm/WalkedTask.h"

#include <cstdint>

namespace tally {

/// Asks the kernel for one mapping after another and hands each to `callback`, until that returns true, the
/// address space ends or the kernel refuses (which is reported; what was handed on stays).
void enumerateRegions(WalkedTask& task, const RegionCallback& callback);

/// Start of the last mapping that ends at or below the shared cache, to 16 MiB; 0 when there is none.
std::uint64_t lastNonSharedCacheRegion(const WalkedTask& task);

/// Says on standard error that the walk of `task` ends before its time.
void announceBailOut(const WalkedTask& task);

} // namespace tally
