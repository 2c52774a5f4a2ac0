// OwnedGather: what the lists of owned objects share within one gather.
//
// An object with several holders is charged to one of them: the first whose list is asked for. Thread-safe.

#pragma once

#include "platform/linux/owned/SysVSegments.h"

#include <cstdint>
#include <vector>

namespace tally::platform {

/// Whether the process `pid` is the one that lists the object. Without a gather every holder is.
bool claimOwnedObject(std::uint64_t objectId, std::int32_t pid);

/// The SysV segments that process `pid`, which started at `startTicks`, has created. Read once per gather.
std::vector<SysVSegment> segmentsCreatedBy(std::int32_t pid, std::uint64_t startTicks);

} // namespace tally::platform
