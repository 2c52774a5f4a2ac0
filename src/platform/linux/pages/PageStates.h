// The states of a process's pages: how many of each mapping are where, and for what is shared or of a file
// which.

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace tally::platform {

enum class PageKind : std::uint8_t {
    object,    // a page of the file or shared memory that is mapped
    anonymous, // the task's own: anonymous memory, or its copy of a file's page
    swapped,   // the task's own, swapped out
};

/// Consecutive pages of one kind; page numbers count from the start of the mapping.
struct PageRun {
    std::uint64_t firstPage = 0;
    std::uint64_t pages = 0;
    PageKind kind = PageKind::object;

    std::uint64_t endPage() const { return firstPage + pages; }
};

/// Pages of one mapping. Its runs are a slice of PageStates::runs, empty for private anonymous memory.
struct MappingPages {
    std::uint64_t object = 0;
    std::uint64_t anonymous = 0;
    std::uint64_t swapped = 0;
    std::size_t firstRun = 0;
    std::size_t runCount = 0;
    bool unreadable = false;

    std::uint64_t own() const { return anonymous + swapped; }
};

struct PageStates {
    std::vector<MappingPages> mappings; // one per mapping, as far as the task lived
    std::vector<PageRun> runs;

    PageStates() = default;
    explicit PageStates(std::size_t mappingCount) : mappings(mappingCount) {}

    /// Adds what `part` has of the mapping that is its `from`-th to mapping `index`, which no other follows.
    void append(std::size_t index, const PageStates& part, std::size_t from);

    std::span<const PageRun> runsOf(const MappingPages& pages) const {
        return std::span(runs).subspan(pages.firstRun, pages.runCount);
    }
};

/// Enters runs of pages, in rising order within a mapping, into its counts and runs.
class PageRecorder {
  public:
    /// @param states one per mapping.
    PageRecorder(std::span<const Mapping> mappings, PageStates* states)
        : mappings_(mappings), states_(states) {}

    /// Records the addresses [start, end), which lie in mapping `index`.
    void record(std::size_t index, std::uint64_t start, std::uint64_t end, PageKind kind);

  private:
    std::span<const Mapping> mappings_;
    PageStates* states_;
};

} // namespace tally::platform
