// FamilyMember: one process of a family, whose private memory is read window by window beside its relatives'.
//
// The idea: small mappings are read as page table entries at once, which tell the state of each page and its
// frame. What is larger may be a reservation, or huge pages: there the kernel is asked first where pages are,
// and frames are read only where a relative has pages too, until it proves to be full of single pages that
// relatives have as well. Cost: every small mapping once, of larger ones what is there. Where frames are
// hidden everything is asked for first, since entries alone do not tell the zero page then. Once opened, any
// number of threads may read, each its own addresses.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/families/AskedPages.h"
#include "platform/linux/families/SharedParts.h"
#include "platform/linux/families/SharingSets.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/linux/pages/PageSource.h"
#include "platform/linux/pages/PageStates.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"
#include "platform/linux/pages/SmapsOfProcess.h"

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

/// The address space of one process as a walk needs it.
struct AddressSpace {
    kern_return_t status = KERN_SUCCESS; // KERN_INVALID_ARGUMENT: ended; `states` holds what was read in full
    std::string folder;
    std::vector<Mapping> mappings;
    PageStates states;
    std::vector<SharedPart> parts; // what is shared with relatives, sorted by mapping
    bool isEstimated = false;      // sharing was told by addresses only, without frame numbers
};

inline constexpr std::size_t windowPages = 512; // a huge page or a part of one, and aligned like that
inline const std::uint64_t windowBytes = windowPages * basePage;

/// The pages that one member has of its own in one window.
struct WindowRow {
    enum class Holds : std::uint8_t { nothing, pages, hugePage };

    std::uint32_t member = 0;
    Holds holds = Holds::nothing;
    std::array<PageKey, windowPages> keys; // by page, 0 for none; of a huge page the first one only

    /// Writes the keys of a huge page out, for a relative that has single pages there.
    void writeOut();
    /// Whether it is mostly there, in single pages.
    bool isFullOfPages() const;
};

/// The private mappings of a member in some addresses, while they are read.
struct MemberStretch {
    std::size_t member = 0;
    std::size_t firstMapping = 0; // that reaches into the addresses
    kern_return_t status = KERN_SUCCESS;
    PageStates states;           // of the mappings from the first on; until the member ended
    std::vector<FoundRun> asked; // runs of its own pages in mappings that are asked for first, rising
    std::size_t nextAsked = 0;   // the first that ends above the windows so far
    std::size_t nextMapping = 0; // likewise, an index of privateMappings()
    std::size_t full = none;     // a larger mapping that is read at once in these addresses

    static constexpr std::size_t none = ~std::size_t{0};

    /// Notes that nothing can be read from `mapping` on.
    void breakOff(int error, std::size_t mapping);
};

class FamilyMember {
  public:
    /// Opens the process, lists its mappings and reads those that no relative can share page by page.
    FamilyMember(MemberIdentity identity, std::uint32_t number);

    bool isReadable() const { return space_.status == KERN_SUCCESS; }
    const std::vector<MemberMapping>& privateMappings() const { return privateMappings_; }

    /// The first address from `address` on where it may have a page in a private mapping; all ones for none.
    /// For one thread at a time, like begin(); addresses rise.
    std::uint64_t nextPage(std::uint64_t address);
    /// Begins to read the private mappings in `range`.
    MemberStretch begin(AddressRange range);

    /// The same within a stretch that was begun.
    std::uint64_t nextPage(const MemberStretch& stretch, std::uint64_t address) const;
    /// Reads the window that begins at `start` of mappings that are read at once, and notes in `row` what the
    /// member has of its own there. Windows rise. @return false when frames are hidden.
    bool readWindow(std::uint64_t start, MemberStretch& stretch, WindowRow& row) const;
    /// Reads the frames of what was asked for first, into the same row. @return false when they are hidden.
    bool readFrames(std::uint64_t start, MemberStretch& stretch, WindowRow& row) const;

    /// Takes what the last window below `end` held, which a relative has pages in too, as a sign of what
    /// follows; null where none has.
    void expect(std::uint64_t end, const WindowRow* last);

    /// Adds what a stretch has read; stretches come in rising order.
    void append(const MemberStretch& stretch);
    AddressSpace takeSpace() { return std::move(space_); }

  private:
    std::vector<Mapping>::const_iterator mappingAbove(std::uint64_t address) const;
    std::vector<MemberMapping>::const_iterator privateAbove(std::uint64_t address) const;
    bool readAtOnce(std::span<const MemberMapping> neighbours, AddressRange window, MemberStretch& stretch,
                    WindowRow& row) const;
    bool isReadAtOnce(std::size_t mapping, std::size_t full) const;

    std::uint32_t number_;
    ProcessMemoryFiles files_;
    AddressSpace space_;
    std::unique_ptr<SmapsOfProcess> smaps_;
    std::unique_ptr<PageSource> source_;
    std::vector<MemberMapping> privateMappings_;
    std::atomic<std::size_t> full_ = MemberStretch::none; // the mapping that was mostly there last
    std::unique_ptr<AskedPages> asked_;
};

} // namespace tally::platform
