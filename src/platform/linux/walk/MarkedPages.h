// The marked pages of an object: of a file those that are not on disk yet, of shared memory those that are
// swapped out.
//
// They are filed as an object of their own. A page is then in one state with everybody who maps it,
// neighbours of two states never form one range, and the union of what several processes map is exact. Marked
// pages are numbered through, and so are the others: however many of both a mapping has, they fit into it.

#pragma once

#include "platform/linux/objects/PageCache.h"
#include "platform/linux/walk/CountedPages.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <vector>

namespace tally::platform {

/// Page numbers count from the start of the object.
class MarkedPages {
  public:
    MarkedPages() = default;
    /// @param ranges the marked pages, in rising order.
    explicit MarkedPages(std::span<const PageRange> ranges) { append(ranges); }

    /// By the numbers that pages have among the marked ones and among the others.
    struct Division {
        std::vector<PageRange> marked;
        std::vector<PageRange> others;
    };

    /// How many marked pages lie below `page`.
    std::uint64_t countBelow(std::uint64_t page) const;
    /// Appends what of `range` is marked, and what is not.
    void divide(PageRange range, Division* division) const;

    std::uint64_t knownEnd() const { return knownEnd_; }
    /// @return these and those up to `end`; absent when `file` cannot be asked.
    std::shared_ptr<const MarkedPages> extendedTo(std::uint64_t end, const Descriptor& file,
                                                  std::uint64_t CachedPages::*mark) const;

  private:
    struct Marked {
        PageRange range;
        std::uint64_t below = 0; // marked pages before it
    };
    /// The first range that ends above `page`.
    std::vector<Marked>::const_iterator firstAbove(std::uint64_t page) const;
    void append(std::span<const PageRange> ranges);

    std::uint64_t knownEnd_ = 0; // pages behind it were not asked for
    std::vector<Marked> marked_;
};

/// The marked pages of an object up to page `end`, asked once in a gather; null when the file
/// cannot be asked. @param openFile called when it has to be. Any number of threads may ask.
std::shared_ptr<const MarkedPages> markedPages(std::uint64_t objectId, std::uint64_t end,
                                               std::uint64_t CachedPages::*mark,
                                               const std::function<Descriptor()>& openFile);

} // namespace tally::platform
