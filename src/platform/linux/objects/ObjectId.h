// Identities of VM objects: 64-bit hashes of what tells an object from every other.
//
// Equal in every process, run and snapshot of one boot; never 0 and never all ones.

#pragma once

#include "platform/linux/objects/BackingObject.h"

#include <cstdint>

namespace tally::platform {

/// A file, shared memory or a device.
std::uint64_t objectIdOfFile(const BackingObject& object);
/// Of the pages of that object that are filed apart: a file's that are not on disk yet, shared memory's that
/// are swapped out.
std::uint64_t objectIdOfMarkedPages(std::uint64_t objectId);

/// Memory that only the task (pid, start time) has, behind the mapping that starts at `start`.
std::uint64_t objectIdOfTaskMemory(std::int32_t pid, std::uint64_t startTicks, std::uint64_t start);

/// One identity made of three facts; building block of the ones below.
std::uint64_t combinedIdentity(std::uint64_t first, std::uint64_t second, std::uint64_t third);

/// Anonymous memory that exactly the processes of the identity `set` share after a fork, in the mappings of
/// `cluster`, which overlap one another.
std::uint64_t objectIdOfSharedSet(std::uint64_t set, std::uint64_t cluster);

/// The resident, or the swapped, pages that `firstHolder` shares with changing sets of relatives.
std::uint64_t objectIdOfFoldedSets(std::uint64_t firstHolder, std::uint64_t cluster, bool resident);

/// Memory that a driver or the kernel itself keeps for whoever holds a descriptor, by the number that the
/// kernel gives it.
enum class KernelBuffer : std::uint8_t { dmaBuffer, graphicsClient, bpfMap };
std::uint64_t objectIdOfKernelBuffer(KernelBuffer kind, std::uint64_t number);

} // namespace tally::platform
