#include "process/TLUserProcess.h"

#include "base/Assertion.h"
#include "base/Format.h"
#include "platform/gather.h"
#include "process/LedgerLayout.h"
#include "vm/ImageData.h"
#include "vm/OwnedObjects.h"
#include "vm/PageClassification.h"
#include "vm/RegionRecorder.h"
#include "vm/RegionWalk.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace tally {

using namespace platform;

bool TLUserProcess::initWithBsdInfo(const proc_bsdinfo& info) {
    setPid(static_cast<std::int32_t>(info.pbi_pid));
    _gatherIsTranslated();
    if (!TLProcess::initWithBsdInfo(info)) {
        return false;
    }
    if (task() != MACH_PORT_NULL) {
        setSharedCache(TLSharedCache::sharedCacheForTask(task()));
    }
    _gatherPhysTally();
    _gatherIdleExitStatus();
    return true;
}

bool TLUserProcess::_populateTask() {
    mach_port_t task = MACH_PORT_NULL;
    const kern_return_t status = task_read_for_pid(pid(), &task);
    if (status != KERN_SUCCESS) {
        recordRefusal("task_read_for_pid", status);
        return false;
    }
    setTask(PortRight(task));
    return true;
}

/// Page tables belong to the first of several processes that share their address space: known only when all
/// are opened, which several threads do at once.
void TLUserProcess::gatherPageTableSize() {
    if (!breakDownPhysTally() || !_isAlive()) {
        return;
    }
    const LedgerLayout& layout = ledgerLayout();
    if (!layout.entryCount || !layout.pageTable) {
        return;
    }
    std::vector<ledger_entry_info> entries(*layout.entryCount);
    const int count = ledger_entries(pid(), entries);
    if (count < 0) {
        walk_.reportWarning("Unable to retrieve ledger entry info");
        return;
    }
    tl_assert(static_cast<std::size_t>(count) > *layout.pageTable, "count > pageTableIndex");
    ledgers_.pageTable =
        static_cast<std::uint64_t>(std::max<std::int64_t>(entries[*layout.pageTable].lei_balance, 0));
}

void TLUserProcess::_gatherPhysTally() {
    rusage_info_v5 usage;
    if (_isAlive() && proc_pid_rusage(pid(), &usage) == 0) {
        ledgers_.physTally = usage.ri_phys_tally;
        ledgers_.physTallyPeak = usage.ri_lifetime_max_phys_tally;
    }
}

void TLUserProcess::_gatherIdleExitStatus() {
    if (_isAlive()) {
        std::uint32_t flags = 0;
        proc_get_dirty(pid(), &flags);
        _setIdleExitStatusFromDirtyFlags(flags);
    }
}

void TLUserProcess::_setIdleExitStatusFromDirtyFlags(std::uint32_t flags) {
    constexpr std::uint32_t tracked = PROC_DIRTY_TRACKED | PROC_DIRTY_ALLOWS_IDLE_EXIT;
    if ((flags & tracked) != tracked) {
        setIdleExitStatus(TLIdleExitStatus::notTracked);
    } else {
        setIdleExitStatus((flags & PROC_DIRTY_IS_DIRTY) != 0 ? TLIdleExitStatus::dirty
                                                             : TLIdleExitStatus::clean);
    }
}

void TLUserProcess::_gatherImageData() { tally::gatherImageData(walk_); }

std::optional<OwnedVmObjects> TLUserProcess::_gatherOwnedVmObjects() { return gatherOwnedVmObjects(walk_); }

void TLUserProcess::enumerateRegions(const RegionCallback& callback) {
    tally::enumerateRegions(walk_, callback);
}

bool TLUserProcess::_populateMemoryRegionWithPageQueries(TLMemoryRegion& region,
                                                         const vm_region_submap_info_64& /*info*/) {
    return populateMemoryRegionWithPageQueries(walk_, region);
}

void TLUserProcess::_addSubrangesForRegion(TLMemoryRegion& region, int purgeState) {
    addSubrangesForRegion(walk_, region, purgeState);
}

WalkedTask TLUserProcess::makeWalk() {
    return {.task = task(),
            .pid = pid(),
            .pageSize = pageSize(),
            .breakDownPhysTally = breakDownPhysTally(),
            .isAlive = _isAlive(),
            .hiddenFromDisplay = hiddenFromDisplay(),
            .displayString = displayString(),
            .sharedCache = sharedCache(),
            .addWarning = [this](std::string text) { addWarning(std::move(text)); },
            .addError = [this](std::string text) { addError(std::move(text)); },
            .populateMemoryRegionWithPageQueries =
                [this](TLMemoryRegion& region, const vm_region_submap_info_64& info) {
                    return _populateMemoryRegionWithPageQueries(region, info);
                },
            .addSubrangesForRegion = [this](TLMemoryRegion& region,
                                            int purgeState) { _addSubrangesForRegion(region, purgeState); }};
}

void TLUserProcess::gatherData() {
    if (hasMemoryRegions()) {
        return;
    }
    if (!_configurePageSize()) {
        printLineToStandardError("skipping process " + displayString() +
                                 " due to an error configuring page size for analysis");
        return;
    }
    walk_ = makeWalk();
    if (!hiddenFromDisplay()) {
        _gatherImageData();
        _gatherPhysTally();
        gatherPageTableSize();
        walk_.ownedVmObjects = _gatherOwnedVmObjects();
    }
    RegionRecorder recorder(walk_);
    enumerateRegions([&](const EnumeratedRegion& mapping) { return recorder.record(mapping); });
    recorder.recordUnmappedOwnedObjects();
    recordPageTables();
    task_notices notices = task_take_notices(task());
    for (std::string& notice : notices.of_task) {
        addWarning(std::move(notice));
    }
    for (std::string& notice : notices.of_machine) {
        addMachineWarning(std::move(notice));
    }
    walk_.regions.shrink_to_fit();
    setMemoryRegions(std::move(walk_.regions));
    walk_ = WalkedTask();
}

void TLUserProcess::recordPageTables() {
    if (!breakDownPhysTally() || ledgers_.pageTable == 0) {
        return;
    }
    TLMemoryRegion region;
    region.start = TLNotSet;
    region.size = ledgers_.pageTable;
    region.dirtySize = ledgers_.pageTable;
    region.name = Name("page table");
    region.object_id = TLNotSet;
    region.share_mode = SM_PRIVATE;
    walk_.regions.push_back(std::move(region));
}

std::optional<TLAuxDictionary> TLUserProcess::auxData() const {
    if (ledgers_.physTally == 0) {
        return std::nullopt;
    }
    const auto leaf = [](std::uint64_t bytes) {
        return TLAuxData(static_cast<std::int64_t>(bytes), /*shouldAggregate=*/false);
    };
    return TLAuxDictionary{
        {{"phys_tally", leaf(ledgers_.physTally)}, {"phys_tally_peak", leaf(ledgers_.physTallyPeak)}}};
}

} // namespace tally
