// Finding the pages of a range of which only a number is known.

#pragma once

#include "platform/linux/objects/PageCache.h"
#include "platform/linux/walk/CountedPages.h"

#include <cstddef>
#include <cstdint>
#include <vector>

namespace tally::platform {

/// Finds which pages of a file are dirty, or swapped out, by halving ranges and asking for each half.
/// Cost: two questions per page found and level at most, and never more than some ten thousand: past that the
/// first pages of what is left stand for the ones that are meant.
class PageFinder {
  public:
    /// @param figure which count is asked for.
    PageFinder(const Descriptor& file, std::uint64_t CachedPages::*figure) : file_(&file), figure_(figure) {}

    /// Appends the pages of `range` (page numbers in the file) that are meant to `found`, in rising order.
    /// @return false when the file cannot be asked; nothing is appended then.
    bool find(PageRange range, std::vector<PageRange>* found);

  private:
    void halve(PageRange range, std::uint64_t count, std::vector<PageRange>* found);
    std::uint64_t countIn(PageRange range);

    const Descriptor* file_;
    std::uint64_t CachedPages::*figure_;
    std::size_t questionsLeft_ = 65536;
    bool wasRefused_ = false;
};

} // namespace tally::platform
