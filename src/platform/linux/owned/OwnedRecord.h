// OwnedRecord: one object that a task keeps alive without mapping it, as the kernel's list tells it.

#pragma once

#include <cstdint>

namespace tally::platform {

/// Sizes in bytes.
struct OwnedRecord {
    // Flags.
    static constexpr std::uint64_t notCharged = 1; // somebody else pays for it
    static constexpr std::uint64_t notPurgeable = 3 << 4;
    static constexpr std::uint64_t graphics = 4 << 1; // ledger tag

    std::uint64_t objectId = 0;
    std::uint64_t virtualSize = 0;
    std::uint64_t residentSize = 0;
    std::uint64_t wiredSize = 0;
    std::uint64_t reusableSize = 0;
    std::uint64_t compressedSize = 0; // swapped out
    std::uint64_t flags = notPurgeable;

    bool holdsMemory() const { return residentSize + compressedSize != 0; }
};
static_assert(sizeof(OwnedRecord) == 56);

} // namespace tally::platform
