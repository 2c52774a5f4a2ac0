// The mappings of a process, from its open maps file.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/pages/Mapping.h"

#include <vector>

namespace tally::platform {

/// Lists the mappings in rising order, by queries where the kernel answers them (6.11 and later), else from
/// the text. Both name the same mappings; [vsyscall] is left out.
/// @return false on failure, with errno; `mappings` is not complete then.
bool listMappings(const Descriptor& maps, std::vector<Mapping>* mappings);

} // namespace tally::platform
