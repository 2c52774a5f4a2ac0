// VM user tags: what allocated a mapping, as far as the kernel or the memory itself tells.

#pragma once

#include "platform/linux/objects/Backing.h"
#include "platform/linux/walk/Mapping.h"

#include <cstdint>

namespace tally::platform {

/// The tag of a mapping; 0 where nothing tells. An honest "untagged" is better than a guess.
std::uint32_t tagOf(const Mapping& mapping, const BackingObject& object);

} // namespace tally::platform
