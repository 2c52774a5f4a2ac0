// Processes whose regions a test writes down. Sizes, offsets and addresses are in pages.

#pragma once

#include "analysis/TLTally.h"
#include "base/Format.h"
#include "platform/mach_vm.h"
#include "platform/scripted/ScriptedKernel.h"
#include "vm/PhysTallyCollection.h"

#include <gtest/gtest.h>

namespace tally {

inline constexpr std::uint64_t page = 4096;

struct RegionRecord {
    const char* name = "heap";
    const char* detail = nullptr;
    std::uint64_t object = 0, size = 0, dirty = 0, swapped = 0, clean = 0, reclaimable = 0;
    std::uint64_t offset = 0, start = 0x10;
    TLSegmentKind segment = TLSegmentKind::none;
    std::uint8_t share_mode = platform::SM_PRIVATE;
    bool inSharedCache = false, owned = false, unmapped = false, wired = false, verbose = false;
};

class ReadyProcess : public TLProcess {
  public:
    ReadyProcess(std::int32_t pid, const std::vector<RegionRecord>& records, const char* name) {
        setPid(pid);
        setIs64bit(true);
        setPageSize(page);
        setName(name);
        setDisplayString(formatted("%s [%d]", name, pid));
        for (const RegionRecord& record : records) {
            TLMemoryRegion& region = memoryRegions().emplace_back();
            region.name = Name(record.name);
            region.detailedName = record.detail == nullptr ? Name() : Name(record.detail);
            region.object_id = record.object;
            region.size = record.size * page;
            region.dirtySize = record.dirty * page;
            region.swappedSize = record.swapped * page;
            region.cleanNonSpecSize = record.clean * page;
            region.reclaimableSize = record.reclaimable * page;
            region.offset = record.offset * page;
            region.start = record.unmapped ? TLNotSet : record.start * page;
            region.user_tag = record.unmapped ? TLUnmappedTag : 0;
            region.segment = record.segment;
            region.share_mode = record.share_mode;
            region.inSharedCache = record.inSharedCache;
            region.ownedExclusivelyByParentProcess = record.owned;
            region.wired = record.wired;
            region.verbose = record.verbose;
        }
    }
    std::optional<TLAuxDictionary> auxData() const override { return aux; }

    std::optional<TLAuxDictionary> aux;
};

inline std::shared_ptr<ReadyProcess> ready(std::int32_t pid, const std::vector<RegionRecord>& records,
                                           const char* name = "p") {
    return std::make_shared<ReadyProcess>(pid, records, name);
}

/// A kernel with the accounting switch on.
class AnalysisTest : public testing::Test {
  protected:
    AnalysisTest() { setPhysTallyCollectionEnabled(1); }

    platform::ScriptedKernel kernel;
};

} // namespace tally
