// TLMemoryObject: one kernel VM object, with all regions that map it.
//
// Turns the sizes of its regions into totals without counting a page twice, and answers how the object looks
// from one process. Accepts regions until finalizeSizes, then is only read. Points to regions, which their
// processes own and keep in place.

#pragma once

#include "base/IntegerTable.h"
#include "base/Name.h"
#include "vm/MemoryHolder.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TLRangeList.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace tally {

/// A list of regions that it does not own. Most lists hold one region, and that one is held in place.
class TLRegionPointers {
  public:
    TLRegionPointers() = default;
    TLRegionPointers(TLRegionPointers&&) = default;
    TLRegionPointers& operator=(TLRegionPointers&&) = default;
    ~TLRegionPointers() = default;
    TLRegionPointers(const TLRegionPointers& other)
        : first_(other.first_), all_(other.all_ ? std::make_unique<List>(*other.all_) : nullptr) {}
    TLRegionPointers& operator=(const TLRegionPointers& other) { return *this = TLRegionPointers(other); }

    void push_back(TLMemoryRegion* region);
    std::size_t size() const { return all_ ? all_->size() : first_ == nullptr ? 0 : 1; }
    bool empty() const { return first_ == nullptr; }
    TLMemoryRegion* front() const { return first_; }
    TLMemoryRegion* const* begin() const { return all_ ? all_->data() : &first_; }
    TLMemoryRegion* const* end() const { return begin() + size(); }

  private:
    using List = std::vector<TLMemoryRegion*>;

    TLMemoryRegion* first_ = nullptr;
    std::unique_ptr<List> all_; // absent unless there is more than one
};

class TLMemoryObject : public std::enable_shared_from_this<TLMemoryObject> {
  public:
    using RegionList = TLRegionPointers;
    using ProcessRegionList = std::pair<std::int32_t, RegionList>; // of the pid

    TLMemoryObject() = default;
    TLMemoryObject(const TLMemoryObject&) = delete;
    TLMemoryObject& operator=(const TLMemoryObject&) = delete;

    /// Adds a region of `process`, which must be given.
    void addRegionForProcess(TLMemoryRegion& region, const MemoryHolder* process);
    void addRegionWithPageSize(TLMemoryRegion& region, std::uint64_t pageSize, const MemoryHolder* process);
    /// Computes the totals, once. `breakDown`: as the plain sums of what the regions are charged.
    void finalizeSizes(bool breakDown);

    bool hasUnmappedOwnedRegion() const { return hasUnmappedOwnedRegion_; }
    bool hasProcessSpecificSizes() const;
    /// The region whose names the object bears; null when it has none.
    const TLMemoryRegion* representativeRegion() const;
    Name name() const;
    Name detailedName() const;
    std::string fullName() const; // empty without a region
    /// The flag of the first region.
    bool verbose() const;

    /// The object as `process` sees it: the object itself, or one made for the process.
    std::shared_ptr<const TLMemoryObject> viewForProcess(const MemoryHolder& process) const;
    /// A copy of a final object: its dirty, swapped, clean and wired totals, its regions and its owner.
    std::shared_ptr<TLMemoryObject> copy() const;

    TLRangeSizes totals;        // valid once accurateSizes
    std::int32_t ownerPid = -1; // -1: none

    /// The object's place in a list that the report under way makes of its objects: a region leads to it
    /// without a look-up. Only the report uses it.
    static constexpr std::size_t notInReport = ~std::size_t{0};
    std::size_t reportIndex = notInReport;

    bool accurateSizes() const { return accurateSizes_; }
    const RegionList& memoryRegions() const {
        return original_ == nullptr ? memoryRegions_ : original_->memoryRegions();
    }
    const TLRangeList* rangeList() const { return rangeList_.get(); }
    /// Lists of regions by rising pid; empty unless they add information.
    const std::vector<ProcessRegionList>& processMemoryRegions() const { return processMemoryRegions_; }

  private:
    const RegionList* regionsOf(std::int32_t pid) const;
    RegionList& makeRegionsOf(std::int32_t pid);
    bool processListsAddInformation() const;
    void nameUnmappedRegions();

    bool accurateSizes_ = false;
    bool hasUnmappedOwnedRegion_ = false;
    RegionList memoryRegions_;                       // in order of adding
    std::shared_ptr<const TLMemoryObject> original_; // of a copy: the object whose regions it has
    std::vector<ProcessRegionList> processMemoryRegions_;
    std::unique_ptr<TLRangeList> rangeList_; // dropped when sizes are final
    // Most objects are mapped once, as a whole: their one range is its region's, and no list is made of it.
    const TLMemoryRegion* onlyRange_ = nullptr;
    std::uint64_t onlyRangePageSize_ = 0;
};

} // namespace tally
