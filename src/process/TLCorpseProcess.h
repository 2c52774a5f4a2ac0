// TLCorpseProcess: the corpse of a process as a target.
//
// Walked like a running process; what that is asked for at run time (identity, ledger figures, idle-exit
// state) comes from the crash information that the kernel attaches to a corpse.

#pragma once

#include "process/TLUserProcess.h"

namespace tally {

class TLCorpseProcess final : public TLUserProcess {
  public:
    /// The process of `corpse`, of which it takes a reference of its own; null when the crash information is
    /// unreadable or the reference is refused.
    static std::shared_ptr<TLCorpseProcess> initWithCorpse(platform::mach_port_t corpse);

    bool _populateTask() override { return task() != platform::MACH_PORT_NULL; }
    bool _isAlive() const override { return false; }
    void _gatherIdleExitStatus() override {}
    std::optional<OwnedVmObjects> _gatherOwnedVmObjects() override { return std::nullopt; }
};

} // namespace tally
