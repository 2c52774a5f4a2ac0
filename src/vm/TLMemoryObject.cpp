#include "vm/TLMemoryObject.h"

#include "base/Assertion.h"
#include "vm/PhysTallyCollection.h"

#include <algorithm>
#include <functional>
#include <utility>

namespace tally {

namespace {

/// What the regions hold one by one; bytes.
TLRangeSizes sumOfSizes(const TLRegionPointers& regions) {
    TLRangeSizes sum;
    for (const TLMemoryRegion* region : regions) {
        sum += region->sizes();
    }
    return sum;
}

/// The first region that is wanted, else the first one.
const TLMemoryRegion* firstRegionOrHead(const TLRegionPointers& regions, auto&& isWanted) {
    const auto* const found = std::find_if(regions.begin(), regions.end(), isWanted);
    return found == regions.end() ? regions.front() : *found;
}

} // namespace

void TLRegionPointers::push_back(TLMemoryRegion* region) {
    if (first_ == nullptr) {
        first_ = region;
        return;
    }
    if (!all_) {
        all_ = std::make_unique<List>(1, first_);
    }
    all_->push_back(region);
}

void TLMemoryObject::addRegionForProcess(TLMemoryRegion& region, const MemoryHolder* process) {
    tl_assert(process != nullptr, "process");
    addRegionWithPageSize(region, process->pageSize(), process);
}

void TLMemoryObject::addRegionWithPageSize(TLMemoryRegion& region, std::uint64_t pageSize,
                                           const MemoryHolder* process) {
    tl_assert(!accurateSizes_, "!self.accurateSizes");
    memoryRegions_.push_back(&region);
    hasUnmappedOwnedRegion_ = hasUnmappedOwnedRegion_ || region.user_tag == TLUnmappedTag;
    if (region.object_id == 0) {
        return;
    }
    if (process != nullptr && (!processMemoryRegions_.empty() || region.isSharedMapping())) {
        makeRegionsOf(process->pid()).push_back(&region);
    }
    if (!rangeList_ && onlyRange_ == nullptr && !region.subrangeList) {
        onlyRange_ = &region;
        onlyRangePageSize_ = pageSize;
        return;
    }
    if (!rangeList_) {
        rangeList_ = std::make_unique<TLRangeList>();
    }
    if (onlyRange_ != nullptr) {
        rangeList_->addRegionRange(*std::exchange(onlyRange_, nullptr), onlyRangePageSize_);
    }
    rangeList_->addRegionRange(region, pageSize);
    region.subrangeList.reset();
}

void TLMemoryObject::finalizeSizes(bool breakDown) {
    tl_assert(!accurateSizes_, "!self.accurateSizes");
    totals = rangeList_              ? rangeList_->sumSizes()
             : onlyRange_ != nullptr ? onlyRange_->sizes()
                                     : TLRangeSizes();
    onlyRange_ = nullptr;
    if (breakDown) {
        const TLRangeSizes sum = sumOfSizes(memoryRegions_);
        totals.dirty = sum.dirty;
        totals.swapped = sum.swapped;
    } else if (!processMemoryRegions_.empty() && physTallyCollectionEnabled()) {
        for (const auto& [pid, regions] : processMemoryRegions_) {
            const TLRangeSizes sum = sumOfSizes(regions);
            totals.dirty = std::max(totals.dirty, sum.dirty);
            totals.swapped = std::max(totals.swapped, sum.swapped);
        }
    }
    rangeList_.reset();
    if (!processListsAddInformation()) {
        processMemoryRegions_ = {};
    }
    if (hasUnmappedOwnedRegion_) {
        nameUnmappedRegions();
    }
    accurateSizes_ = true;
}

/// Memory that its owner does not map bears the name under which somebody else maps it.
void TLMemoryObject::nameUnmappedRegions() {
    const TLMemoryRegion& representative = *representativeRegion();
    if (representative.user_tag == TLUnmappedTag) {
        return;
    }
    for (TLMemoryRegion* region : memoryRegions_) {
        if (region->user_tag == TLUnmappedTag) {
            region->name = representative.name;
            region->detailedName = representative.detailedName;
        }
    }
}

/// Whether some process sees the object otherwise than its totals say.
bool TLMemoryObject::processListsAddInformation() const {
    if (processMemoryRegions_.size() < 2) {
        return false;
    }
    return std::ranges::any_of(processMemoryRegions_, [this](const ProcessRegionList& list) {
        return list.second.size() > 1 || list.second.front()->sizes() != totals;
    });
}

const TLMemoryObject::RegionList* TLMemoryObject::regionsOf(std::int32_t pid) const {
    const auto found =
        std::ranges::lower_bound(processMemoryRegions_, pid, std::less(), &ProcessRegionList::first);
    return found != processMemoryRegions_.end() && found->first == pid ? &found->second : nullptr;
}

TLMemoryObject::RegionList& TLMemoryObject::makeRegionsOf(std::int32_t pid) {
    auto found = std::ranges::lower_bound(processMemoryRegions_, pid, std::less(), &ProcessRegionList::first);
    if (found == processMemoryRegions_.end() || found->first != pid) {
        found = processMemoryRegions_.emplace(found, pid, RegionList());
    }
    return found->second;
}

bool TLMemoryObject::hasProcessSpecificSizes() const {
    return !processMemoryRegions_.empty() || ownerPid != -1;
}

const TLMemoryRegion* TLMemoryObject::representativeRegion() const {
    const RegionList& regions = memoryRegions();
    if (!regions.empty() && regions.front()->inSharedCache) {
        return firstRegionOrHead(
            regions, [](const TLMemoryRegion* region) { return !region->unusedSharedCacheRegion; });
    }
    if (ownerPid != -1) {
        return firstRegionOrHead(
            regions, [](const TLMemoryRegion* region) { return region->user_tag != TLUnmappedTag; });
    }
    return regions.front();
}

Name TLMemoryObject::name() const {
    const TLMemoryRegion* const region = representativeRegion();
    return region == nullptr ? Name() : region->name;
}

Name TLMemoryObject::detailedName() const {
    const TLMemoryRegion* const region = representativeRegion();
    return region == nullptr ? Name() : region->detailedName;
}

std::string TLMemoryObject::fullName() const {
    const TLMemoryRegion* const region = representativeRegion();
    return region == nullptr ? std::string() : region->fullName();
}

bool TLMemoryObject::verbose() const { return !memoryRegions().empty() && memoryRegions().front()->verbose; }

std::shared_ptr<const TLMemoryObject> TLMemoryObject::viewForProcess(const MemoryHolder& process) const {
    std::shared_ptr<const TLMemoryObject> view = shared_from_this();
    if (const RegionList* const regions = regionsOf(process.pid())) {
        const auto own = std::make_shared<TLMemoryObject>();
        own->ownerPid = ownerPid;
        for (TLMemoryRegion* region : *regions) {
            own->addRegionWithPageSize(*region, process.pageSize(), nullptr);
        }
        own->finalizeSizes(process.breakDownPhysTally());
        view = own;
    }
    if (ownerPid != -1 && ownerPid != process.pid()) { // another process pays for it
        const auto paidByOwner = view->copy();
        paidByOwner->totals.dirty = 0;
        paidByOwner->totals.swapped = 0;
        paidByOwner->totals.clean = view->totals.clean + totals.charged();
        view = paidByOwner;
    }
    return view;
}

std::shared_ptr<TLMemoryObject> TLMemoryObject::copy() const {
    tl_assert(accurateSizes_ && !rangeList_, "self.accurateSizes && !self.rangeList");
    const auto copied = std::make_shared<TLMemoryObject>();
    copied->totals = totals;
    copied->totals.reclaimable = 0;
    copied->original_ = shared_from_this();
    copied->hasUnmappedOwnedRegion_ = hasUnmappedOwnedRegion_;
    copied->accurateSizes_ = true;
    copied->ownerPid = ownerPid;
    return copied;
}

} // namespace tally
