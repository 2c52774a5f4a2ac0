// TLUserProcess: a running process as a target, and the base of the targets that stand for one.
//
// Made with its identity, its task port and its ledger figures; gatherData walks the address space once and
// leaves the final list of regions. Hooks are the steps that other kinds replace; what they do for a running
// process is decided in vm/.

#pragma once

#include "platform/mach_task.h"
#include "process/TLProcess.h"
#include "vm/RegionEnumeration.h"
#include "vm/WalkedTask.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace tally {

class TLUserProcess : public TLProcess {
  public:
    /// Ledger figures of a task, in bytes.
    struct Ledgers {
        std::uint64_t pageTable = 0;
        std::uint64_t physTally = 0;
        std::uint64_t physTallyPeak = 0;
    };

    bool initWithBsdInfo(const platform::proc_bsdinfo& info) override;
    void gatherData() override;
    /// What the task is charged for, now and at most; absent when that is not known.
    std::optional<TLAuxDictionary> auxData() const override;

    platform::mach_port_t task() const { return task_.name(); }
    std::uint64_t phys_tally() const { return ledgers_.physTally; } // bytes

    // Hooks.
    bool _populateTask() override;
    bool _isAlive() const override { return true; }
    virtual bool _populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                                      const platform::vm_region_submap_info_64& info);
    virtual void _addSubrangesForRegion(TLMemoryRegion& region, int purgeState);
    virtual void _gatherIsTranslated() {}
    virtual bool _configurePageSize() { return true; }
    virtual void _gatherIdleExitStatus();
    virtual void _gatherPhysTally();
    virtual void _gatherImageData();
    virtual std::optional<OwnedVmObjects> _gatherOwnedVmObjects();
    virtual void enumerateRegions(const RegionCallback& callback);

  protected:
    WalkedTask makeWalk();
    void _setIdleExitStatusFromDirtyFlags(std::uint32_t flags);
    void setTask(platform::PortRight task) { task_ = std::move(task); }
    void setLedgers(const Ledgers& ledgers) { ledgers_ = ledgers; }

    WalkedTask walk_; // while it is gathered

  private:
    void gatherPageTableSize();
    void recordPageTables();

    platform::PortRight task_;
    Ledgers ledgers_;
};

} // namespace tally
