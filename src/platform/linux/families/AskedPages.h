// AskedPages: where pages are in mappings that may be reservations, asked of the kernel a little ahead of
// where they are read.
//
// Each page is asked for once, and what lies empty between two pages costs no call of its own. Addresses rise
// from call to call. One thread at a time.

#pragma once

#include "platform/linux/pages/PageSource.h"

#include <cstddef>
#include <cstdint>
#include <deque>
#include <span>
#include <vector>

namespace tally::platform {

class AskedPages {
  public:
    /// @param asked indices of the mappings that are asked about, rising.
    AskedPages(const PageSource& source, std::span<const Mapping> mappings, std::vector<std::size_t> asked)
        : source_(source), mappings_(mappings), asked_(std::move(asked)) {}

    /// The first page at or above `address`; all ones when there is none.
    std::uint64_t next(std::uint64_t address);
    /// Takes the runs below `end`.
    std::vector<FoundRun> takeBelow(std::uint64_t end);
    /// Passes over what lies below `address`.
    void skip(std::uint64_t address);
    /// Why no more pages can be told; 0 as long as they can.
    int error() const { return error_; }

  private:
    bool askOn();

    const PageSource& source_;
    std::span<const Mapping> mappings_;
    std::vector<std::size_t> asked_;
    std::size_t at_ = 0; // in asked_: the mapping that is being asked about
    ScanCursor cursor_;
    std::deque<FoundRun> runs_; // that were not taken yet, rising
    int error_ = 0;
};

} // namespace tally::platform
