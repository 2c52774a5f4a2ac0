// HeldPages: where the pages of one process's own memory were at one moment.
//
// Relatives that are looked at one after the other share a page when both held the same frame at the same
// address. A frame that only one of them mapped when it was looked at proves nothing, since it can have
// become the other's meanwhile; of pages in swap, their place there must do.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/families/SharedParts.h"
#include "platform/linux/families/SharingSets.h"
#include "platform/linux/pages/Mapping.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace tally::platform {

/// One page as pagemap shows it.
struct HeldPage {
    PageKey key = 0;        // 0: not held, or the frame is hidden
    bool exclusive = false; // no other process mapped it
};

class HeldPages {
  public:
    /// Appends the entries of pagemap from `address` on; addresses rise.
    void append(std::uint64_t address, std::span<const std::uint64_t> entries);
    /// To be called once all are appended. Of huge pages the kernel says "exclusive" by their first part.
    void distrustHugePages();

    HeldPage at(std::uint64_t address) const;
    /// The first address at or above `address` that has an entry; all ones when there is none.
    std::uint64_t nextHeld(std::uint64_t address) const;
    /// Whether pages are held and all their frames hidden.
    bool areFramesHidden() const;

  private:
    struct Run {
        std::uint64_t start = 0; // address
        std::uint64_t end = 0;
        std::size_t first = 0; // entry
    };
    std::vector<Run>::const_iterator runAt(std::uint64_t address) const;

    std::vector<Run> runs_;
    std::vector<std::uint64_t> entries_;
};

/// Reads the pages of the private mappings of a process that holds still into `held`. @return
/// KERN_INVALID_ARGUMENT when it has ended, another error when not all of them could be read.
kern_return_t readHeldPages(MemberIdentity identity, std::span<const Mapping> mappings, HeldPages* held);

} // namespace tally::platform
