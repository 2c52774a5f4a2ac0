// WalkedTask: what the walk of an address space needs of the process that it walks.
//
// The process implements it; steps that a kind of process replaces are hooks. Used by the one thread that
// gathers the process.

#pragma once

#include "base/IntegerTable.h"
#include "platform/bsd_process.h"
#include "platform/kern_return.h"
#include "platform/mach_vm.h"
#include "vm/MemoryHolder.h"
#include "vm/TLImage.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TLSharedCache.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tally {

/// By object id.
using OwnedVmObjects = IntegerTable<platform::owned_vmobject>;

/// What exists while a process is gathered and no longer.
struct WalkState {
    std::vector<TLMemoryRegion> regions;          // made so far; indices stay valid, references do not
    std::vector<TLImage> images;                  // sorted by start
    std::optional<OwnedVmObjects> ownedVmObjects; // not matched to a mapping yet; absent: not gathered

    // The last page that was asked for when a piece of the shared cache ended inside it.
    std::uint64_t cachedDispositionAddress = TLNotSet;
    std::int32_t cachedDisposition = 0;
    /// Index of the gap of the shared cache whose last page the next piece will ask for.
    std::optional<std::size_t> pendingUnusedSharedRegion;
};

class WalkedTask : public virtual MemoryHolder {
  public:
    virtual platform::mach_port_t task() const = 0;
    virtual const std::string& displayString() const = 0;
    virtual bool hiddenFromDisplay() const = 0;
    virtual const std::shared_ptr<const TLSharedCache>& sharedCache() const = 0;
    virtual void addWarning(std::string text) = 0;
    virtual void addError(std::string text) = 0;

    // Hooks.
    virtual bool _isAlive() const = 0;
    virtual bool _populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                                      const platform::vm_region_submap_info_64& info) = 0;
    virtual void _addSubrangesForRegion(TLMemoryRegion& region, int purgeState) = 0;

    /// Reports `message` with the text of the current errno: a warning, and a line on standard error.
    void reportWarning(std::string_view message);
    /// Records that the kernel refused to describe a region: a warning when that is because the process has
    /// ended, else an error.
    void recordRegionError(platform::kern_return_t status);

    WalkState walk;
};

} // namespace tally
