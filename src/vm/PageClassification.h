// Page classification: sizes from the state of every page, where the counts of a mapping are not enough.

#pragma once

#include "vm/WalkedTask.h"

namespace tally {

/// Sets the dirty and swapped bytes of a piece of the shared cache; both must be 0. Bytes of a page that two
/// pieces share are apportioned exactly, and the page is asked for once. A gap must be the last of the task's
/// regions: its last page may be settled with the piece that follows.
/// @return false, with the error recorded, when the state of its pages could not be read.
bool populateMemoryRegionWithPageQueries(WalkedTask& task, TLMemoryRegion& region);

/// Splits a shared mapping into runs of pages of one state. Leaves it whole, with the error recorded, when
/// the state of its pages could not be read.
void addSubrangesForRegion(WalkedTask& task, TLMemoryRegion& region, int purgeState);

} // namespace tally
