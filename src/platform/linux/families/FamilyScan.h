// FamilyScan: reads a family of forked processes side by side and finds which pages they share.
//
// The idea: relatives that still share a page have the same frame at the same address (and, once it is
// swapped out, the same place in swap). Windows of a few MiB are read of all members before the next, so
// memory does not grow with the family, and the kernel finds the descriptions of shared pages in its caches.
// Cost: a page table entry per page and member. Frames are compared wherever two members have pages of their
// own, also where the kernel says "mapped once": of a huge page that bit tells the first part only.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/families/SharedParts.h"
#include "platform/linux/walk/Mapping.h"
#include "platform/linux/walk/PageStates.h"
#include "platform/linux/walk/ProcessMemoryFiles.h"

#include <cstdint>
#include <string>
#include <vector>

namespace tally::platform {

/// The address space of one process as a walk needs it.
struct AddressSpace {
    kern_return_t status = KERN_SUCCESS; // KERN_INVALID_ARGUMENT: ended; `states` holds what was read in full
    std::string folder;
    std::vector<Mapping> mappings;
    PageStates states;
    std::vector<SharedPart> parts; // what is shared with relatives, sorted by mapping
    bool isEstimated = false;      // sharing was told by addresses only, without frame numbers
};

/// Reads the address spaces of `members`, which are rising by pid and share no address space among them.
std::vector<AddressSpace> scanFamily(std::uint64_t familyKey, std::span<const MemberIdentity> members);

} // namespace tally::platform
