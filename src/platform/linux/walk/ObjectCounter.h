// ObjectCounter: which pages of the file or shared memory behind a mapping the task counts, and in what
// state: as charged to the task, or as the VM object sees them.
//
// One counter serves one walk, mapping after mapping in rising order.

#pragma once

#include "platform/linux/families/FamilyScan.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/pages/PageStates.h"
#include "platform/linux/pages/SmapsOfProcess.h"
#include "platform/linux/walk/CountedPages.h"
#include "platform/linux/walk/MarkedPages.h"
#include "platform/linux/walk/Piece.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

/// Pages of one object that a mapping counts.
struct ObjectPages {
    std::uint64_t id = 0;
    std::uint64_t offset = 0; // bytes in the object
    std::uint64_t resident = 0;
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::vector<PageWords> words; // by page behind `offset`; empty when the counts say enough

    std::uint64_t held() const { return resident + swapped; }
};

/// The marked pages of what is mapped, and all others, as two objects.
struct DividedObject {
    ObjectPages others;
    ObjectPages marked;
    std::uint64_t markedRoom = 0; // marked pages in the mapped range, whoever has them
    bool restIsApart = false;     // what is not there is a piece of its own
};

class ObjectCounter {
  public:
    /// @param backings one per mapping of `space`. All that is passed must outlive the counter.
    ObjectCounter(const AddressSpace& space, std::span<const BackingObject> backings, bool swapInUse,
                  SmapsOfProcess& smaps);

    /// What the task's page tables show, each page at the first mapping that shows it, and what is swapped
    /// out of the mapped range.
    DividedObject charged(std::size_t index);
    /// The pages of the object in the mapped range, whoever brought them there.
    DividedObject seen(std::size_t index);

    /// Whether a figure had to be taken from a poorer source because rights or the kernel did not allow
    /// better.
    bool usedEstimates() const { return usedEstimates_; }

  private:
    PageRange rangeOf(std::size_t index) const;
    DividedObject startOf(std::size_t index) const;
    std::vector<PageRange> residentPages(std::size_t index);
    std::vector<PageRange> notYetCounted(std::uint64_t objectId, std::span<const PageRange> ranges);
    std::vector<PageRange> absentPages(std::size_t index) const;
    std::shared_ptr<const MarkedPages> marksOf(std::size_t index, std::span<const PageRange> resident);
    MarkedPages estimatedMarks(std::size_t index, std::span<const PageRange> resident);
    DividedObject dividedBy(const MarkedPages& marks, std::size_t index, std::span<const PageRange> resident);

    std::span<const Mapping> mappings_;
    const PageStates& states_;
    const std::string& folder_;
    std::span<const BackingObject> backings_;
    bool swapInUse_;
    SmapsOfProcess& smaps_;
    CountedPages counted_;
    bool usedEstimates_ = false;
};

} // namespace tally::platform
