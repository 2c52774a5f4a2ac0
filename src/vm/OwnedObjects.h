// Owned objects: what a task is charged for as its owner, whether it maps it or not.
//
// Decides what a record of the kernel's list is charged, and how it becomes sizes of a region. A record is
// matched to the first mapping that shows its object; those that no mapping shows become regions of their
// own.

#pragma once

#include "base/IntegerTable.h"
#include "base/Name.h"

#include <cstdint>
#include <optional>

namespace tally {

struct TLMemoryRegion;
class WalkedTask;

/// One record of the kernel's reply (56 bytes); sizes in bytes.
struct OwnedVmObject {
    std::uint64_t objectId = 0;
    std::uint64_t virtualSize = 0;
    std::uint64_t residentSize = 0;
    std::uint64_t wiredSize = 0;
    std::uint64_t reusableSize = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t flags = 0;

    bool isNotCharged() const { return (flags & 1) != 0; }
    std::uint64_t ledgerTag() const { return flags >> 1 & 7; }
    int purgeState() const { return static_cast<int>(flags >> 4 & 3); }
};
static_assert(sizeof(OwnedVmObject) == 56);

/// By object id.
using OwnedVmObjects = IntegerTable<OwnedVmObject>;

/// The objects that `task` owns; absent when the accounting switch is off or the kernel does not list them.
std::optional<OwnedVmObjects> gatherOwnedVmObjects(WalkedTask& task);

/// Marks `region` as the object's and gives it the sizes that the owner is charged.
void chargeOwnedObject(TLMemoryRegion& region, const OwnedVmObject& object);

/// `tagName`, with the name of the object's ledger tag in parentheses when that has one.
Name nameWithLedgerTag(Name tagName, const OwnedVmObject& object);

/// The region of an object that no mapping of its owner shows.
TLMemoryRegion unmappedRegionForOwnedObject(const OwnedVmObject& object);

} // namespace tally
