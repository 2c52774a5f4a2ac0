// Owned objects: what a task is charged for as its owner, whether it maps it or not.
//
// Decides what a record of the kernel's list is charged, and how it becomes sizes of a region. A record is
// matched to the first mapping that shows its object; those that no mapping shows become regions of their
// own.

#pragma once

#include "base/Name.h"
#include "vm/WalkedTask.h"

#include <optional>

namespace tally {

/// The objects that `task` owns; absent when the accounting switch is off or the kernel does not list them.
std::optional<OwnedVmObjects> gatherOwnedVmObjects(WalkedTask& task);

/// Marks `region` as the object's and gives it the sizes that the owner is charged.
void chargeOwnedObject(TLMemoryRegion& region, const platform::owned_vmobject& object);

/// `tagName`, with the name of the object's ledger tag in parentheses when that has one.
Name nameWithLedgerTag(Name tagName, const platform::owned_vmobject& object);

/// The region of an object that no mapping of its owner shows.
TLMemoryRegion unmappedRegionForOwnedObject(const platform::owned_vmobject& object);

} // namespace tally
