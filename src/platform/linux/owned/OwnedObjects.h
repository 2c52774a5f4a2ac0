// The objects that a task keeps alive without mapping them.

#pragma once

#include "platform/bsd_process.h"
#include "platform/linux/machine/MemberIdentity.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/mach_vm.h"

#include <cstdint>
#include <map>
#include <optional>
#include <span>
#include <string>

namespace tally::platform {

using OwnedObjects = std::map<std::uint64_t, owned_vmobject>; // by object id

/// What `task` owns and is the one to list. @param mappings all of its own. @param folder where its files
/// are.
/// @return absent with errno when it has ended.
std::optional<OwnedObjects> ownedObjectsOf(MemberIdentity task, std::span<const Mapping> mappings,
                                           const std::string& folder);

} // namespace tally::platform
