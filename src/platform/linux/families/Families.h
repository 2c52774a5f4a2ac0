// Families: which of the processes that are measured descend from one exec by forking.
//
// Families are found among the tasks to which rights exist when the first of them is walked in a gather. The
// sharing of a family is computed once per gather, by all workers that need it meanwhile. Processes that
// share one whole address space count as one: the lowest pid stands for them. Thread-safe.

#pragma once

#include "platform/linux/families/FamilyKey.h"
#include "platform/linux/families/FamilyScan.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>

namespace tally::platform {

/// Who stands for an address space: of the tasks that have entered it, the one with the lowest pid. Rights
/// are made by several threads at once, so that it can change until all are made.
using AddressSpaceOwner = std::shared_ptr<const MemberIdentity>;

/// Enters a task to which a right was made, and with it every relative that shares its address space whole.
/// Nothing is known of the relatives of a task without a known key.
AddressSpaceOwner enterAddressSpace(const FamilyKey& key, MemberIdentity task);

MemberIdentity identityOf(const AddressSpaceOwner& owner);

/// Takes back what enterAddressSpace entered.
void leaveAddressSpace(const FamilyKey& key, MemberIdentity task);

/// The processes to which there are rights, with the keys of their families.
std::map<std::int32_t, FamilyKey> enteredProcesses();

/// How many processes to which there are rights, be it several, descend from the exec of `key`.
std::size_t countRelatives(const FamilyKey& key);

/// The address space of the process that `owner` stands for, read together with its relatives. Absent when it
/// has none among the tasks, when no gather is under way, or when it could not be read with them.
std::optional<AddressSpace> takeFamilySpace(const FamilyKey& key, MemberIdentity owner);

} // namespace tally::platform
