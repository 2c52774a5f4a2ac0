// Pieces of the shared library cache: a mapping of the cache is cut where images begin and end.

#pragma once

#include "vm/RegionEnumeration.h"
#include "vm/TLImage.h"
#include "vm/WalkedTask.h"

namespace tally {

/// Appends the image pieces of `mapping` and the gaps between them to the task's regions.
/// @return false, after a message, when the state of a piece's pages could not be read.
bool recordSharedCachePieces(WalkedTask& task, TLImageEnumerator& images, const EnumeratedRegion& mapping);

} // namespace tally
