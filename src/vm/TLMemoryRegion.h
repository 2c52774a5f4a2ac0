// TLMemoryRegion: one mapped range of a process, a piece of one, or memory that is charged to it unmapped.
//
// A plain record of at most 160 bytes: a process can have 100,000 of them. The walk makes and sizes it. The
// analysis adds it to one memory object; where it is not mapped it takes that object's name. Then it is only
// read.

#pragma once

#include "base/Name.h"
#include "vm/TLRangeSizes.h"

#include <cstdint>
#include <memory>
#include <string>

namespace tally {

class TLMemoryObject;
class TLRangeList;

/// User tag of memory that is owned but not mapped.
inline constexpr std::uint32_t TLUnmappedTag = 0xFFFFFFFF;
/// An address or id that is not set.
inline constexpr std::uint64_t TLNotSet = ~std::uint64_t{0};

/// Which kind of image segment covers a region.
enum class TLSegmentKind : std::uint8_t {
    notSet = 0,   // pseudo-regions, shared cache without an image on either side
    none = 1,     // an ordinary mapping that no image segment covers
    text = 2,     // "__TEXT...", "__OBJC_RO...", image headers
    data = 3,     // any other segment whose name begins "__"
    linkedit = 4, // "__LINKEDIT"
};

struct TLMemoryRegion {
    TLMemoryRegion();
    TLMemoryRegion(TLMemoryRegion&&) noexcept;
    TLMemoryRegion& operator=(TLMemoryRegion&&) noexcept;
    ~TLMemoryRegion();

    bool wired : 1 = false;
    bool inSharedCache : 1 = false;
    bool unusedSharedCacheRegion : 1 = false;         // no image covers this piece of the cache
    bool ownedExclusivelyByParentProcess : 1 = false; // stands for an object that its process owns
    bool verbose : 1 = false;                         // a reserved area, listed in verbose output only
    TLSegmentKind segment = TLSegmentKind::notSet;
    std::uint8_t share_mode = 0;            // SM_...
    std::uint32_t user_tag = 0;             // 0-255, or TLUnmappedTag
    TLMemoryObject* memoryObject = nullptr; // not owned
    Name name;
    Name detailedName;        // second part of the display name; may be absent
    std::uint64_t offset = 0; // of the first byte in the VM object
    std::uint64_t start = 0;  // TLNotSet: not mapped
    // Bytes.
    std::uint64_t size = 0;
    std::uint64_t dirtySize = 0;
    std::uint64_t reclaimableSize = 0; // can be taken back without loss
    std::uint64_t swappedSize = 0;
    std::uint64_t cleanNonSpecSize = 0;
    std::uint64_t object_id = 0;               // 0: no object; TLNotSet: the page tables
    std::unique_ptr<TLRangeList> subrangeList; // dropped once its object has merged it

    /// `start` + `size`; TLNotSet for a region that is not mapped.
    std::uint64_t end() const { return start == TLNotSet ? TLNotSet : start + size; }
    /// Sets `size`; an end below the start stops the program.
    void setEnd(std::uint64_t end);
    std::uint64_t chargedSize() const { return dirtySize + swappedSize; }
    /// Its sizes as one range.
    TLRangeSizes sizes() const;
    /// `name`, and after a blank `detailedName` when that has characters.
    std::string fullName() const;
    /// Whether several processes may see different parts of the mapping.
    bool isSharedMapping() const;
    /// Whether the mapping is shared and only partly in one state, so that its pages must be asked.
    bool needsSubrangeBreakdown(std::uint64_t pageSize) const;
    /// Adds a piece with its own sizes; `start` is an offset in the VM object.
    void addSubrange(std::uint64_t start, std::uint64_t size, const TLRangeSizes& sizes,
                     std::uint64_t pageSize);
};
static_assert(sizeof(TLMemoryRegion) <= 160);

} // namespace tally
