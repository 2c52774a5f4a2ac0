// TLKernelProcess: the kernel itself as a target.
//
// It has no address space to walk: its zones and accounting sites, as the kernel tells them, become regions
// that no address belongs to, so that it passes through the same analysis and report as every process.

#pragma once

#include "platform/mach_kernel_memory.h"
#include "process/TLProcess.h"

#include <cstdint>
#include <optional>

namespace tally {

class KernelSiteNames;

class TLKernelProcess final : public TLProcess {
  public:
    bool initWithBsdInfo(const platform::proc_bsdinfo& info) override;
    void gatherData() override;
    /// One entry, "Maps": the kernel's counters.
    std::optional<TLAuxDictionary> auxData() const override { return TLAuxDictionary{{{"Maps", auxData_}}}; }

    bool _populateTask() override { return true; }
    bool _isAlive() const override { return true; }

  private:
    void addZones(const platform::mach_memory_record& record, RegionList& regions) const;
    void addSites(const platform::mach_memory_record& record, RegionList& regions);

    TLAuxDictionary auxData_;
};

} // namespace tally
