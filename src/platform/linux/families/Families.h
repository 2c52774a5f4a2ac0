// Families: which of the processes that are measured descend from one exec by forking.
//
// Families are found among the tasks to which rights exist when the first of them is walked in a gather. The
// sharing of a family is computed once per gather, by all workers that need it meanwhile. Processes that
// share one whole address space count as one: the lowest pid stands for them. Thread-safe.

#pragma once

#include "platform/linux/families/FamilyKey.h"
#include "platform/linux/families/FamilyScan.h"

#include <optional>

namespace tally::platform {

/// Enters a task to which a right was made. @return who stands for its address space: itself, or a relative
/// with a lower pid that shares it whole.
MemberIdentity enterAddressSpace(const FamilyKey& key, MemberIdentity task);

/// Takes back what enterAddressSpace entered.
void leaveAddressSpace(const FamilyKey& key, MemberIdentity task);

/// How many processes to which there are rights, be it several, descend from the exec of `key`.
std::size_t countRelatives(const FamilyKey& key);

/// The address space of the process that `owner` stands for, read together with its relatives. Absent when it
/// has none among the tasks, when no gather is under way, or when it could not be read with them.
std::optional<AddressSpace> takeFamilySpace(const FamilyKey& key, MemberIdentity owner);

/// Begins and ends the gather for which families are found.
void beginFamilies();
void endFamilies();

} // namespace tally::platform
