// Corpse: what is kept of a process that was looked at once, while it held still.
//
// Everything that a report asks is read then; afterwards the process may change or end. Corpses of forked
// relatives are made one after the other, so what they share is found when the first of them is walked.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/corpse/HeldPages.h"
#include "platform/linux/families/FamilyKey.h"
#include "platform/linux/walk/Walk.h"
#include "platform/runekit.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <utility>
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

class Corpse {
  public:
    Corpse(MemberIdentity identity, std::shared_ptr<CorpseSpace> space,
           std::vector<std::byte> crashInformation)
        : identity_(identity), space_(std::move(space)), crashInformation_(std::move(crashInformation)) {}

    MemberIdentity identity() const { return identity_; }
    MemberIdentity owner() const { return space_->owner; }
    /// The address space, which no longer changes once it has been asked for.
    const Walk* walk() const;
    std::span<const RKSymbolOwner> images() const { return space_->images; }
    std::span<const std::byte> crashInformation() const { return crashInformation_; }
    /// Whether there is a corpse of another process that descends from the same exec, as far as can be told.
    bool hasRelatives() const;
    /// What was noted about its figures so far: of two processes with one address space each has it.
    std::vector<std::string> notices() const;

  private:
    MemberIdentity identity_;
    std::shared_ptr<CorpseSpace> space_;
    std::vector<std::byte> crashInformation_;
};

/// Makes a corpse of the process `task`. Its threads hold still for as long as it takes to read their page
/// tables.
/// @return KERN_SUCCESS, or what StoppedThreads or Walk say.
kern_return_t makeCorpse(MemberIdentity task, std::shared_ptr<Corpse>* corpse);

} // namespace tally::platform
