// Which mappings the rules for memory without a name look at.

#pragma once

#include "platform/linux/pages/Mapping.h"

namespace tally::platform {

inline bool isInaccessible(const Mapping& mapping) {
    return !mapping.readable && !mapping.writable && !mapping.executable;
}

/// Private anonymous memory without a name.
inline bool isNamelessMemory(const Mapping& mapping) {
    return mapping.isPrivateAnonymous() && mapping.name.empty();
}

} // namespace tally::platform
