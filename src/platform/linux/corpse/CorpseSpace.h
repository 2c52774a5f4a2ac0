// CorpseSpace: the address space of one corpse or several.

#pragma once

#include "platform/linux/corpse/HeldPages.h"
#include "platform/linux/families/FamilyKey.h"
#include "platform/linux/walk/Walk.h"
#include "platform/runekit.h"

#include <array>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace tally::platform {

/// The address space of a corpse. Tasks that have one in common have one here too, as it was when the first
/// of them was looked at.
struct CorpseSpace {
    MemberIdentity owner;
    FamilyKey key;
    std::array<std::uint64_t, 2> execRandom{}; // of programs whose layout is fixed, else zeros
    std::unique_ptr<Walk> walk;
    std::vector<RKSymbolOwner> images;
    HeldPages held; // of processes that have relatives
    std::vector<std::string> notices;
    bool isSettled = false; // what relatives share is known
};

} // namespace tally::platform
