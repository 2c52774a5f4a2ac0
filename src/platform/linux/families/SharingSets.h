// SharingSets: which processes hold one page, found page by page, and how many pages each set holds where.
//
// The idea: a page of one address is told from others by a key, its frame number or its place in swap.
// Relatives with equal keys share the page. Every distinct set of two or more holders gets a number; pages
// are counted per set and slot. A page with one holder is that process's own and counts nowhere here. Cost:
// one step per page and process; a set is looked up by the exclusive-or of random numbers of its members. Not
// thread-safe: one object serves one family.

#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <unordered_map>
#include <vector>

namespace tally::platform {

/// What tells a page from others; 0 is no page.
using PageKey = std::uint64_t;
inline constexpr PageKey residentKey = PageKey{1} << 63; // this bit: in memory; without it: swapped out

/// Pages that the members of `set` all hold in one slot.
struct SetPages {
    std::size_t slot = 0;
    std::size_t set = 0;
    std::uint64_t resident = 0;
    std::uint64_t swapped = 0;
};

class SharingSets {
  public:
    explicit SharingSets(std::size_t members);

    /// Enters one page, or `pages` neighbours that are alike: `keys` holds its key in each of `members` (two
    /// or more, rising). Slots come in rising order.
    void addPages(std::size_t slot, std::span<const std::uint32_t> members, std::span<const PageKey> keys,
                  std::uint64_t pages);
    /// Adds what `other` of the same family has counted, in the same slot or above.
    void absorb(SharingSets& other);
    /// What was counted, in rising order of slots. No page may be entered afterwards.
    std::vector<SetPages> takeCounts();

    /// The members of each set, rising; every set has two or more.
    const std::vector<std::vector<std::uint32_t>>& sets() const { return sets_; }

  private:
    struct Holders { // of one key, while a page is looked at
        PageKey key = 0;
        std::uint64_t page = 0; // the page for which the entry is valid
        std::uint64_t signature = 0;
        std::uint32_t count = 0;
    };

    std::size_t setOf(std::uint64_t signature, PageKey key, std::span<const std::uint32_t> members,
                      std::span<const PageKey> keys);
    std::size_t numberOf(std::uint64_t signature);
    void count(std::size_t set, std::uint64_t resident, std::uint64_t swapped);
    void begin(std::size_t slot);
    void flush();

    std::vector<std::uint64_t> memberSignatures_;
    std::vector<Holders> table_;      // open addressing, a power of two
    std::vector<std::uint32_t> used_; // entries of the current page
    std::uint64_t page_ = 0;
    std::unordered_map<std::uint64_t, std::size_t> setBySignature_;
    std::vector<std::vector<std::uint32_t>> sets_;
    std::vector<std::uint64_t> signatures_; // of each set
    std::uint64_t lastSignature_ = 0;
    std::size_t lastSet_ = 0;
    std::size_t slot_ = 0;             // that is being counted
    std::vector<SetPages> inSlot_;     // per set, of the current slot
    std::vector<std::size_t> touched_; // sets with pages in the current slot
    std::vector<SetPages> counts_;
};

} // namespace tally::platform
