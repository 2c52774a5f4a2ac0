// The images of a process: the ELF files among its mappings, and the pages of code that the kernel gives it.

#pragma once

#include "platform/linux/pages/Mapping.h"
#include "platform/runekit.h"

#include <span>
#include <string>
#include <vector>

namespace tally::platform {

/// @param mappings all of the process whose folder is `folder`.
std::vector<RKSymbolOwner> symbolOwnersOf(std::span<const Mapping> mappings, const std::string& folder);

} // namespace tally::platform
