// Task: what a port right to a process stands for, and the table of such rights.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/families/Families.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/walk/Walk.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace tally::platform {

class Corpse;

/// One process, by pid and start time: a pid that is used again is another task; or the corpse of one. Holds
/// no descriptor. The walk that is under way is used by one thread at a time.
class Task {
  public:
    Task(MemberIdentity identity, const FamilyKey& key);
    explicit Task(std::shared_ptr<Corpse> corpse);
    ~Task();
    Task(const Task&) = delete;
    Task& operator=(const Task&) = delete;

    std::int32_t pid() const { return identity_.pid; }
    /// Whether a task with a lower pid has the very same address space, and so its page tables too.
    bool isSecondTenant() const { return identityOf(owner_).pid != identity_.pid; }
    /// Whether there is a right to another process that descends from the same exec, as far as can be told.
    bool hasRelatives() const;
    std::uint64_t startTicks() const { return identity_.startTicks; }
    const FamilyKey& familyKey() const { return key_; }
    MemberIdentity identity() const { return identity_; }
    /// What is left of the process; null for one that runs.
    const Corpse* corpse() const { return corpse_.get(); }

    /// The walk that is under way; starts one when there is none.
    /// @return null with `*status` when the address space cannot be read, until the walk is ended.
    const Walk* walk(kern_return_t* status);
    void endWalk() {
        walk_.reset();
        walkStatus_ = KERN_SUCCESS;
    }
    /// Keeps what was just read of the process's status, for the walk that follows.
    void noteStatus(const ProcessStatus& status) { status_ = status; }
    /// What its walk has counted; absent before it was walked as a whole, and of corpses.
    std::optional<ResidentMemory> resident() const;
    /// Keeps what a usage record said, for the ledger that is asked for next: both are of one reading.
    void noteCharges(const Charges& charges) { charges_ = charges; }
    std::optional<Charges> takeCharges() { return std::exchange(charges_, {}); }
    std::vector<std::string> takeNotices();
    /// Adds notices; each is given once.
    void addNotices(std::vector<std::string> notices);

  private:
    MemberIdentity identity_;
    FamilyKey key_;
    AddressSpaceOwner owner_;
    std::shared_ptr<Corpse> corpse_;
    std::optional<ProcessStatus> status_;
    std::optional<Charges> charges_;
    std::unique_ptr<const Walk> walk_;
    kern_return_t walkStatus_ = KERN_SUCCESS;
    std::vector<std::string> notices_;
    std::vector<std::string> given_; // notices that were given once already
};

/// A right to `task`, with one reference.
mach_port_t makePort(std::shared_ptr<Task> task);

/// The task that `port` names; null when it names none.
std::shared_ptr<Task> taskOfPort(mach_port_t port);

/// The running task of process `pid` to which a right exists; null when there is none.
std::shared_ptr<Task> taskOfProcess(std::int32_t pid);

/// Adds to the references of a right, which is gone with the last. @return KERN_INVALID_ARGUMENT for no
/// right.
kern_return_t changeReferences(mach_port_t port, int change);

} // namespace tally::platform
