// CountedPages: which pages of files and shared memory a task has counted already.
//
// A task that maps a page twice is charged for it once: at the first of its mappings, in rising order of
// addresses.

#pragma once

#include <cstdint>
#include <map>
#include <unordered_map>
#include <vector>

namespace tally::platform {

/// [first, end) of pages.
struct PageRange {
    std::uint64_t first = 0;
    std::uint64_t end = 0;

    std::uint64_t pages() const { return end - first; }
};

class CountedPages {
  public:
    /// Announces that the task maps `range` of the object `id`. All before the first take().
    void expect(std::uint64_t id, PageRange range) { expected_.push_back({id, range}); }
    /// Finds the objects of which a page can be mapped twice; only they are kept track of.
    void prepare();

    /// Appends to `fresh` the parts of `range` that were not counted before, and counts them.
    void take(std::uint64_t id, PageRange range, std::vector<PageRange>* fresh);

  private:
    struct Expected {
        std::uint64_t id;
        PageRange range;
    };
    using Ranges = std::map<std::uint64_t, std::uint64_t>; // first page to end, disjoint

    std::vector<Expected> expected_;
    std::unordered_map<std::uint64_t, Ranges> counted_; // of the objects that are kept track of
};

} // namespace tally::platform
