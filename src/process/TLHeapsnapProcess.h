// TLHeapsnapProcess: a snapshot file as a target.
//
// Gathered like a running process; what such a process asks the kernel comes from the snapshot. It is never
// alive and has no task. Its shared library cache is made up from its architecture, and is no other
// process's.

#pragma once

#include "base/TLError.h"
#include "platform/quarry.h"
#include "process/TLUserProcess.h"

#include <memory>
#include <optional>
#include <string>

namespace tally {

class TLHeapsnapProcess final : public TLUserProcess {
  public:
    /// The process of `graph`; null when it cannot be made.
    static std::shared_ptr<TLHeapsnapProcess>
    initWithGraph(std::unique_ptr<const platform::QRYProcessObjectGraph> graph);

    bool breakDownPhysTally() const override { return graph_->showsPhysTally(); }
    std::uint64_t _gatherPageSize() const override { return graph_->vmPageSize(); }
    bool _populateTask() override { return true; }
    bool _isAlive() const override { return false; }
    bool _populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                              const platform::vm_region_submap_info_64& info) override;
    void _addSubrangesForRegion(TLMemoryRegion& /*region*/, int /*purgeState*/) override {}
    void _gatherIsTranslated() override;
    void _gatherPhysTally() override;
    void _gatherImageData() override {} // the regions tell
    std::optional<OwnedVmObjects> _gatherOwnedVmObjects() override { return std::nullopt; }
    void enumerateRegions(const RegionCallback& callback) override;

  private:
    void makeSharedCache();
    EnumeratedRegion describe(const platform::QRYVMRegion& region, bool inCache) const;

    std::unique_ptr<const platform::QRYProcessObjectGraph> graph_;
};

/// The process whose snapshot is the file `path`; null, with the reason in `error` where that is given, when
/// the file cannot be read or is none.
std::shared_ptr<TLProcess> processWithHeapsnap(const std::string& path, std::optional<TLError>* error);

} // namespace tally
