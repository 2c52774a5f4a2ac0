// VM user tags: what allocated a mapping, as far as the kernel or the memory itself tells.

#pragma once

#include "platform/linux/objects/Backing.h"
#include "platform/linux/pages/Mapping.h"

#include "platform/linux/pages/PageStates.h"

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

/// The tags of the mappings of the process folder `folder`, one each; 0 where nothing tells. An honest
/// "untagged" is better than a guess.
std::vector<std::uint32_t> tagsOf(const std::string& folder, std::span<const Mapping> mappings,
                                  std::span<const BackingObject> objects, const PageStates& states);

} // namespace tally::platform
