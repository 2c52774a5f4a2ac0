// WalkedTask: one walk of an address space: what it needs of the process, and what exists meanwhile.
//
// The process makes it, and steps that a kind of process replaces are callables. Used by the one thread that
// gathers the process.

#pragma once

#include "base/IntegerTable.h"
#include "platform/bsd_process.h"
#include "platform/kern_return.h"
#include "platform/mach_vm.h"
#include "vm/TLImage.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TLSharedCache.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tally {

/// By object id.
using OwnedVmObjects = IntegerTable<platform::owned_vmobject>;

struct WalkedTask {
    platform::mach_port_t task = platform::MACH_PORT_NULL;
    std::int32_t pid = 0;
    std::uint64_t pageSize = 0; // bytes
    bool breakDownPhysTally = false;
    bool isAlive = false;
    bool hiddenFromDisplay = false;
    std::string displayString{};
    std::shared_ptr<const TLSharedCache> sharedCache{};
    std::function<void(std::string)> addWarning{};
    std::function<void(std::string)> addError{};
    std::function<bool(TLMemoryRegion& region, const platform::vm_region_submap_info_64& info)>
        populateMemoryRegionWithPageQueries{};
    std::function<void(TLMemoryRegion& region, int purgeState)> addSubrangesForRegion{};

    std::vector<TLMemoryRegion> regions{};          // made so far; indices stay valid, references do not
    std::vector<TLImage> images{};                  // sorted by start
    std::optional<OwnedVmObjects> ownedVmObjects{}; // not matched to a mapping yet; absent: not gathered

    // The last page that was asked for when a piece of the shared cache ended inside it.
    std::uint64_t cachedDispositionAddress = TLNotSet;
    std::int32_t cachedDisposition = 0;
    /// Index of the gap of the shared cache whose last page the next piece will ask for.
    std::optional<std::size_t> pendingUnusedSharedRegion{};

    /// Reports `message` with the text of the current errno: a warning, and a line on standard error.
    void reportWarning(std::string_view message) const;
    /// Records that the kernel refused to describe a region: a warning when that is because the process has
    /// ended, else an error.
    void recordRegionError(platform::kern_return_t status) const;
};

} // namespace tally
