// The objects that a task keeps alive without mapping them.

#pragma once

#include "platform/linux/machine/MemberIdentity.h"
#include "platform/linux/owned/OwnedRecord.h"
#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string>

namespace tally::platform {

using OwnedRecords = std::map<std::uint64_t, OwnedRecord>; // by object id

/// What `task` owns and is the one to list. @param mappings all of its own. @param folder where its files
/// are.
/// @return absent with errno when it has ended.
std::optional<OwnedRecords> ownedObjectsOf(MemberIdentity task, std::span<const Mapping> mappings,
                                           const std::string& folder);

} // namespace tally::platform
