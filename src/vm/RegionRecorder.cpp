#include "vm/RegionRecorder.h"

#include "base/Format.h"
#include "vm/OwnedObjects.h"
#include "vm/SharedCachePieces.h"
#include "vm/TagNames.h"

#include <algorithm>
#include <cinttypes>
#include <functional>
#include <utility>

namespace tally {

using namespace platform;

namespace {

constexpr std::uint32_t neverOwnedTag = 87; // its purgeable memory is charged to somebody else

struct ReservedArea {
    std::uint64_t start;
    std::uint64_t size;
    const char* name;
};
constexpr ReservedArea reservedAreas[] = {
    {0xFC0000000, 0x40000000, "commpage (reserved)"},
    {0x1000000000, 0x6000000000, "GPU Carveout (reserved)"},
};

const ReservedArea* reservedAreaFor(const EnumeratedRegion& mapping) {
    const auto* const area = std::ranges::find_if(reservedAreas, [&](const ReservedArea& reserved) {
        return reserved.start == mapping.start && reserved.size == mapping.size;
    });
    return area == std::end(reservedAreas) ? nullptr : area;
}

bool isUnmappedMemory(const EnumeratedRegion& mapping) {
    return mapping.info.user_tag == TLUnmappedTag && mapping.purgeState != VM_PURGABLE_VOLATILE &&
           mapping.purgeState != VM_PURGABLE_EMPTY;
}

/// Takes as much of `bytes` as there is off `size`. @return the rest.
std::uint64_t takeOff(std::uint64_t& size, std::uint64_t bytes) {
    const std::uint64_t taken = std::min(size, bytes);
    size -= taken;
    return bytes - taken;
}

} // namespace

RegionRecorder::RegionRecorder(WalkedTask& task)
    : task_(task), images_(task.images), breakDown_(task.breakDownPhysTally) {
    if (const auto& cache = task.sharedCache) {
        cacheBase_ = cache->baseAddress;
        cacheEnd_ = cache->baseAddress + cache->mappedSize;
    }
}

bool RegionRecorder::record(const EnumeratedRegion& mapping) {
    if (mapping.end() > cacheBase_ && mapping.start < cacheEnd_) {
        return !task_.hiddenFromDisplay && !recordSharedCachePieces(task_, images_, mapping);
    }
    recordMapping(mapping);
    return false;
}

void RegionRecorder::recordMapping(const EnumeratedRegion& mapping) {
    const bool isUnmapped = isUnmappedMemory(mapping);
    if (isUnmapped && task_.ownedVmObjects) { // the owned objects say it in more detail
        return;
    }
    TLMemoryRegion region;
    region.start = mapping.start;
    region.size = mapping.size;
    region.user_tag = mapping.info.user_tag;
    region.object_id = mapping.info.object_id_full;
    region.share_mode = mapping.info.share_mode;
    region.offset = mapping.info.offset;
    region.wired = mapping.info.user_wired_count != 0;
    sizeByCounts(region, mapping);
    if (isUnmapped && region.object_id == 0) {
        region.object_id = mapping.info.object_id;
    }
    nameAndMatch(region, mapping);
    if (breakDown_ && !task_.hiddenFromDisplay && region.needsSubrangeBreakdown(task_.pageSize)) {
        task_.addSubrangesForRegion(region, mapping.purgeState);
    }
    if (isUnmapped) {
        kernelsUnmappedRegion_ = std::move(region);
    } else {
        task_.regions.push_back(std::move(region));
    }
}

void RegionRecorder::sizeByCounts(TLMemoryRegion& region, const EnumeratedRegion& mapping) const {
    const vm_region_submap_info_64& info = mapping.info;
    const std::uint64_t pageSize = task_.pageSize;
    const std::uint64_t resident = info.pages_resident;
    const std::uint64_t reusable = info.pages_reusable;
    if (mapping.purgeState == VM_PURGABLE_EMPTY) {
        region.reclaimableSize = mapping.size;
        return;
    }
    if (mapping.purgeState == VM_PURGABLE_VOLATILE) {
        region.reclaimableSize = pageSize * resident;
        return;
    }
    const bool allOfItIsDirty = info.external_pager == 0 && !breakDown_;
    const std::uint64_t kept = resident > reusable ? resident - reusable : 0;
    const std::uint64_t dirty = allOfItIsDirty ? kept : info.pages_dirtied;
    region.dirtySize = pageSize * dirty;
    region.reclaimableSize = pageSize * reusable;
    region.swappedSize = pageSize * info.pages_swapped_out;
    region.cleanNonSpecSize = pageSize * (kept > dirty ? kept - dirty : 0);
}

void RegionRecorder::nameAndMatch(TLMemoryRegion& region, const EnumeratedRegion& mapping) {
    static const Name mappedFile("mapped file");
    region.segment = TLSegmentKind::none;
    region.verbose = mapping.verbose;
    if (const TLImage* image = images_.nextImageOverlapping(mapping.start, mapping.end())) {
        region.name = image->name;
        region.detailedName = image->ownerPath;
        region.segment = image->segment;
    } else if (mapping.presetName) {
        region.name = Name(*mapping.presetName);
    } else if (mapping.fileName || mapping.info.external_pager != 0) {
        region.name = mappedFile;
        region.detailedName = mapping.fileName ? Name(*mapping.fileName) : Name();
    } else if (const ReservedArea* area = reservedAreaFor(mapping)) {
        region.name = Name(area->name);
        region.verbose = true;
    } else {
        region.name = nameForTag(mapping.info.user_tag);
        if (breakDown_) {
            matchOwnedObject(region, mapping);
        }
    }
}

/// Where the process owns the object behind a mapping it is charged for all of it.
void RegionRecorder::matchOwnedObject(TLMemoryRegion& region, const EnumeratedRegion& mapping) {
    auto& owned = task_.ownedVmObjects;
    if (owned) {
        const auto record = owned->find(mapping.info.object_id_full);
        if (record == owned->end()) {
            return;
        }
        chargeOwnedObject(region, record->second);
        region.name = nameWithLedgerTag(region.name, record->second);
        owned->erase(record);
    } else if (mapping.purgeState != VM_PURGABLE_DENY && mapping.info.user_tag != neverOwnedTag &&
               mapping.info.pages_resident != 0) {
        region.ownedExclusivelyByParentProcess = true;
        region.dirtySize += region.cleanNonSpecSize;
        region.swappedSize = 0;
        region.cleanNonSpecSize = 0;
    } else {
        return;
    }
    ownedBehindMappings_ += region.chargedSize();
}

void RegionRecorder::recordUnmappedOwnedObjects() {
    if (const auto& owned = task_.ownedVmObjects) {
        std::vector<const owned_vmobject*> records;
        for (const auto& [id, record] : *owned) {
            records.push_back(&record);
        }
        std::ranges::sort(records, std::less(), &owned_vmobject::id); // the table has no order
        for (const owned_vmobject* record : records) {
            task_.regions.push_back(unmappedRegionForOwnedObject(*record));
        }
    }
    if (kernelsUnmappedRegion_) {
        recordKernelsUnmappedRegion();
    }
}

/// The kernel's figure for owned memory covers what was found behind mappings as well.
void RegionRecorder::recordKernelsUnmappedRegion() {
    TLMemoryRegion& region = *kernelsUnmappedRegion_;
    const std::uint64_t notDirty = takeOff(region.dirtySize, ownedBehindMappings_);
    const std::uint64_t surplus = takeOff(region.swappedSize, notDirty);
    if (surplus != 0) {
        task_.addWarning(task_.displayString +
                         formatted(": Tally changed while analyzing \u2013 unmapped owned physical tally may "
                                   "be over-counted by %" PRIu64 " bytes",
                                   surplus));
    }
    if (region.chargedSize() != 0) {
        region.start = TLNotSet;
        task_.regions.push_back(std::move(region));
    }
}

} // namespace tally
