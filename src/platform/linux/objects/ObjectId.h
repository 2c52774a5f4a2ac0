// Identities of VM objects: 64-bit hashes of what tells an object from every other.
//
// Equal in every process, run and snapshot of one boot; never 0 and never all ones.

#pragma once

#include "platform/linux/objects/Backing.h"

#include <cstdint>

namespace tally::platform {

/// A file, shared memory or a device.
std::uint64_t objectIdOfFile(const BackingObject& object);

/// Memory that only the task (pid, start time) has, behind the mapping that starts at `start`.
std::uint64_t objectIdOfTaskMemory(std::int32_t pid, std::uint64_t startTicks, std::uint64_t start);

} // namespace tally::platform
