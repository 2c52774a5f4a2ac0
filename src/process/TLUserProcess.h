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

class TLUserProcess : public TLProcess, public WalkedTask {
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

    platform::mach_port_t task() const override { return task_.name(); }
    std::uint64_t phys_tally() const { return ledgers_.physTally; } // bytes

    const std::string& displayString() const override { return TLProcess::displayString(); }
    bool hiddenFromDisplay() const override { return TLProcess::hiddenFromDisplay(); }
    const std::shared_ptr<const TLSharedCache>& sharedCache() const override {
        return TLProcess::sharedCache();
    }
    void addWarning(std::string text) override { TLProcess::addWarning(std::move(text)); }
    void addError(std::string text) override { TLProcess::addError(std::move(text)); }

    // Hooks.
    bool _populateTask() override;
    bool _isAlive() const override { return true; }
    bool _populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                              const platform::vm_region_submap_info_64& info) override;
    void _addSubrangesForRegion(TLMemoryRegion& region, int purgeState) override;
    virtual void _gatherIsTranslated() {}
    virtual bool _configurePageSize() { return true; }
    virtual void _gatherIdleExitStatus();
    virtual void _gatherPhysTally();
    virtual void _gatherImageData();
    virtual std::optional<OwnedVmObjects> _gatherOwnedVmObjects();
    virtual void enumerateRegions(const RegionCallback& callback);

  protected:
    void _setIdleExitStatusFromDirtyFlags(std::uint32_t flags);
    void setTask(platform::PortRight task) { task_ = std::move(task); }
    void setLedgers(const Ledgers& ledgers) { ledgers_ = ledgers; }

  private:
    void gatherPageTableSize();
    void recordPageTables();

    platform::PortRight task_;
    Ledgers ledgers_;
};

} // namespace tally
