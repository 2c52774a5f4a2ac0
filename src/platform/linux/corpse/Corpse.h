// Corpse: what is kept of a process that was looked at once, while it held still.
//
// Everything that a report asks is read then; afterwards the process may change or end. Corpses of forked
// relatives are made one after the other, so what they share is found when the first of them is walked.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/corpse/CorpseSpace.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <utility>
#include <vector>

namespace tally::platform {

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
kern_return_t makeCorpse(MemberIdentity task, View view, std::shared_ptr<Corpse>* corpse);

} // namespace tally::platform
