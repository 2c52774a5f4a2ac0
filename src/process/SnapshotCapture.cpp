#include "process/SnapshotCapture.h"

#include "vm/TLRangeList.h"

#include <algorithm>
#include <utility>

namespace tally {

using namespace platform;

namespace {

/// What a region is called when a snapshot is read: its segment's name, and nothing that could be taken for
/// one.
Name typeOf(const TLMemoryRegion& region, bool isFile) {
    static const Name file("mapped file");
    static const Name memory("memory");
    const bool isSegment = region.segment == TLSegmentKind::text || region.segment == TLSegmentKind::data ||
                           region.segment == TLSegmentKind::linkedit;
    return isSegment ? region.name : isFile ? file : memory;
}

} // namespace

void SnapshotCapture::enumerateRegions(const RegionCallback& callback) {
    const std::size_t warningsBefore = warnings().size(); // a walk that breaks off leaves one, or an error
    TLUserProcess::enumerateRegions([&](const EnumeratedRegion& mapping) {
        const std::size_t before = walk_.regions.size();
        const bool ends = callback(mapping);
        for (std::size_t i = before; i < walk_.regions.size(); ++i) {
            addRegion(mapping, walk_.regions[i]);
        }
        return ends;
    });
    isComplete_ = !hasErrors() && warnings().size() == warningsBefore;
}

void SnapshotCapture::addRegion(const EnumeratedRegion& mapping, const TLMemoryRegion& region) {
    const vm_region_submap_info_64& info = mapping.info;
    const auto bytes = [&](std::uint32_t pages) { return pages * pageSize(); };
    QRYVMRegion written;
    written.address = region.start;
    written.length = region.size;
    written.type = typeOf(region, info.external_pager != 0);
    written.path = region.detailedName;
    written.prot = info.protection;
    written.maxProt = info.max_protection;
    written.offset = region.offset;
    written.user_tag = info.user_tag;
    written.resident_size = bytes(info.pages_resident);
    written.shared_now_private_size = bytes(info.pages_shared_now_private);
    written.swapped_out_size = bytes(info.pages_swapped_out);
    written.dirty_size = bytes(info.pages_dirtied);
    written.reusable_size = bytes(info.pages_reusable);
    written.ref_count = static_cast<std::uint16_t>(std::min<std::uint32_t>(info.ref_count, 0xFFFF));
    written.external_pager = info.external_pager;
    written.share_mode = info.share_mode;
    written.object_id = region.object_id;
    written.is_wired = region.wired;
    written.purgeable = static_cast<std::uint8_t>(mapping.purgeState);
    if (region.subrangeList) {
        addPartlyPresentRegion(written, region);
    } else {
        regions_.push_back(written);
    }
}

/// Nobody can ask a snapshot for its pages, so each run of them becomes a region, and so does what lies
/// between, behind which there is nothing.
void SnapshotCapture::addPartlyPresentRegion(const QRYVMRegion& whole, const TLMemoryRegion& region) {
    std::uint64_t next = 0; // bytes from the start of the region
    const auto add = [&](std::uint64_t end, const TLRangeListNode* run) {
        if (end <= next) {
            return;
        }
        QRYVMRegion part = whole;
        part.address += next;
        part.offset += next;
        part.length = end - next;
        part.shared_now_private_size = 0;
        part.resident_size =
            run == nullptr ? 0 : run->sizes.clean + run->sizes.dirty + run->sizes.reclaimable;
        part.dirty_size = run == nullptr ? 0 : run->sizes.dirty;
        part.reusable_size = run == nullptr ? 0 : run->sizes.reclaimable;
        part.swapped_out_size = run == nullptr ? 0 : run->sizes.swapped;
        if (run == nullptr) {
            part.object_id = 0;
            part.is_wired = false;
        }
        regions_.push_back(part);
        next = end;
    };
    for (const TLRangeListNode* run = region.subrangeList->rangeListHead(); run != nullptr;
         run = run->next.get()) {
        add(run->start - region.offset, nullptr);
        add(run->start - region.offset + run->size, run);
    }
    add(region.size, nullptr);
}

/// What the process owns without mapping it, in sum: one region behind all others.
void SnapshotCapture::addUnmappedMemory() {
    QRYVMRegion sum;
    for (const TLMemoryRegion& region : memoryRegions()) {
        if (region.user_tag == TLUnmappedTag) {
            sum.length += region.size;
            sum.dirty_size += region.dirtySize;
            sum.reusable_size += region.reclaimableSize;
            sum.swapped_out_size += region.swappedSize;
        }
    }
    if (sum.length == 0) {
        return;
    }
    sum.address = std::uint64_t{1} << 61;
    sum.type = Name("memory");
    sum.object_id = TLNotSet; // of no object that others could have
    sum.user_tag = TLUnmappedTag;
    sum.resident_size = sum.dirty_size + sum.reusable_size;
    sum.length = std::max(sum.length, sum.resident_size + sum.swapped_out_size);
    sum.share_mode = SM_SHARED;
    regions_.push_back(sum);
}

QRYSnapshot SnapshotCapture::takeSnapshot() {
    addUnmappedMemory();
    QRYSnapshot snapshot;
    snapshot.pid = pid();
    snapshot.processName = name();
    snapshot.is64bit = is64bit();
    snapshot.isTranslated = isTranslated();
    snapshot.architecture = QRYHostArchitecture(is64bit());
    snapshot.vmPageSize = static_cast<std::uint32_t>(pageSize());
    if (const auto data = auxData()) {
        snapshot.physicalTally = static_cast<std::uint64_t>(data->entries.at("phys_tally").leaf().value());
        snapshot.physicalTallyPeak =
            static_cast<std::uint64_t>(data->entries.at("phys_tally_peak").leaf().value());
    }
    snapshot.showsPhysTally = breakDownPhysTally();
    snapshot.regions = std::exchange(regions_, {});
    return snapshot;
}

} // namespace tally
