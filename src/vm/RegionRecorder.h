// RegionRecorder: turns the mappings of one walk into regions.
//
// Decides a region's sizes, its name and whether it stands for an object that the process owns. Mappings of
// the shared library cache are cut into pieces (SharedCachePieces.h). One walk, one thread.

#pragma once

#include "vm/RegionEnumeration.h"
#include "vm/TLImage.h"
#include "vm/WalkedTask.h"

#include <cstdint>
#include <optional>

namespace tally {

class RegionRecorder {
  public:
    /// The regions go to `task.regions`.
    explicit RegionRecorder(WalkedTask& task);

    /// Makes the regions of one mapping; mappings come in rising address order. @return true to end the walk.
    bool record(const EnumeratedRegion& mapping);

    /// After the walk: makes the regions of the owned objects that no mapping showed.
    void recordUnmappedOwnedObjects();

  private:
    void recordMapping(const EnumeratedRegion& mapping);
    void sizeByCounts(TLMemoryRegion& region, const EnumeratedRegion& mapping) const;
    void nameAndMatch(TLMemoryRegion& region, const EnumeratedRegion& mapping);
    void matchOwnedObject(TLMemoryRegion& region, const EnumeratedRegion& mapping);
    void recordKernelsUnmappedRegion();

    WalkedTask& task_;
    TLImageEnumerator images_;
    bool breakDown_;
    std::uint64_t cacheBase_ = 0;
    std::uint64_t cacheEnd_ = 0;
    std::optional<TLMemoryRegion> kernelsUnmappedRegion_; // stands for all that is owned and not mapped
    std::uint64_t ownedBehindMappings_ = 0;               // bytes
};

} // namespace tally
