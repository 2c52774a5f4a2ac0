// Finds out what stands behind a mapping.

#pragma once

#include "platform/linux/objects/BackingObject.h"
#include "platform/linux/pages/Mapping.h"

#include <string>

namespace tally::platform {

/// What a mapping that is listed in the process folder `folder` shows.
/// @param descriptor for a file that the process has open instead of mapped: the path of its descriptor.
BackingObject backingOf(const Mapping& mapping, const std::string& folder,
                        const std::string& descriptor = "");

} // namespace tally::platform
