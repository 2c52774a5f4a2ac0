// CorpseFamilies: which corpses are those of forked relatives, and what these shared.
//
// A family is the corpses of one exec that no gather has met yet. Thread-safe.

#pragma once

#include "platform/linux/corpse/CorpseSpace.h"

#include <memory>
#include <string>
#include <vector>

namespace tally::platform {

/// Enters the address space of a new corpse.
void enterCorpse(const std::shared_ptr<CorpseSpace>& space);

/// The entered space that the live process `task` has too; null when there is none.
std::shared_ptr<CorpseSpace> corpseSpaceOfTwin(const FamilyKey& key, MemberIdentity task);

/// Divides the walk of `space`, and those of its whole family, by what they share. Once; later calls do
/// nothing.
void settleCorpseFamily(CorpseSpace& space);

/// What there is to say of the figures of the space so far.
std::vector<std::string> noticesOf(const CorpseSpace& space);

/// How many spaces descend from the exec of `key`.
std::size_t countCorpses(const FamilyKey& key);

} // namespace tally::platform
