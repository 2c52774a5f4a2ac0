#include "vm/TLMemoryRegion.h"

#include "base/Assertion.h"
#include "platform/mach_vm.h"
#include "vm/TLRangeList.h"

namespace tally {

using namespace platform;

TLMemoryRegion::TLMemoryRegion() = default;
TLMemoryRegion::TLMemoryRegion(TLMemoryRegion&&) noexcept = default;
TLMemoryRegion& TLMemoryRegion::operator=(TLMemoryRegion&&) noexcept = default;
TLMemoryRegion::~TLMemoryRegion() = default;

void TLMemoryRegion::setEnd(std::uint64_t end) {
    tl_assert(end >= start, "end >= self.start");
    size = end - start;
}

std::string TLMemoryRegion::fullName() const {
    std::string text(name.view());
    if (!detailedName.empty()) {
        text += ' ';
        text += detailedName.view();
    }
    return text;
}

bool TLMemoryRegion::isSharedMapping() const {
    const bool isPrivate =
        share_mode == SM_PRIVATE || share_mode == SM_EMPTY || share_mode == SM_PRIVATE_ALIASED;
    const bool isImageSegment = segment == TLSegmentKind::text || segment == TLSegmentKind::data ||
                                segment == TLSegmentKind::linkedit;
    return user_tag != TLUnmappedTag && !inSharedCache && !isPrivate && !isImageSegment;
}

bool TLMemoryRegion::needsSubrangeBreakdown(std::uint64_t pageSize) const {
    if (!isSharedMapping() || ownedExclusivelyByParentProcess || size <= pageSize) {
        return false;
    }
    const bool isUniform =
        dirtySize == size || swappedSize == size || cleanNonSpecSize == size || reclaimableSize == size;
    const bool isUntouched = chargedSize() == 0 && cleanNonSpecSize == 0 && reclaimableSize == 0;
    return !isUniform && !isUntouched;
}

void TLMemoryRegion::addSubrange(std::uint64_t subrangeStart, std::uint64_t subrangeSize,
                                 const TLRangeSizes& sizes, std::uint64_t pageSize) {
    if (!subrangeList) {
        subrangeList = std::make_unique<TLRangeList>();
    }
    subrangeList->addSubrange(subrangeStart, subrangeSize, pageSize, sizes);
}

TLRangeSizes TLMemoryRegion::sizes() const {
    return {.dirty = dirtySize,
            .swapped = swappedSize,
            .clean = cleanNonSpecSize,
            .reclaimable = reclaimableSize,
            .wired = wired ? size : 0};
}

// Beside the region rather than in the list, which knows nothing of regions.
void TLRangeList::addRegionRange(const TLMemoryRegion& region, std::uint64_t pageSize) {
    if (region.subrangeList) {
        mergeRangeList(*region.subrangeList, pageSize);
        return;
    }
    addSubrange(region.offset, region.size, pageSize, region.sizes());
}

} // namespace tally
