// SharedParts: from pages per set of holders to the objects that the report shows.
//
// Every set of holders and cluster of overlapping mappings is an object. Random rewriting makes thousands of
// sets, too many for a reader: the largest are kept, and a page of any other set belongs to an object of its
// first holder, the lowest pid, which maps all of that object. So sums are exact always, and sets for what is
// kept.

#pragma once

#include "platform/linux/families/AddressSlots.h"
#include "platform/linux/families/SharingSets.h"
#include "platform/linux/machine/MemberIdentity.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace tally::platform {

/// What one member holds of one shared object behind one of its mappings.
struct SharedPart {
    std::size_t mapping = 0;
    std::uint64_t objectId = 0;
    std::uint64_t pagesBelow = 0; // of the object, below the mapping
    std::uint64_t resident = 0;   // pages
    std::uint64_t swapped = 0;
};

/// All that is known of a family's sharing.
struct FamilySharing {
    std::uint64_t familyKey = 0;             // hash
    std::span<const MemberIdentity> members; // rising by pid
    std::span<const AddressSlot> slots;
    std::span<const std::vector<std::uint32_t>> sets; // member indices, rising
    std::span<const SetPages> counts;                 // in rising order of slots
    std::span<const char> keepsAllSets;               // per cluster, 1 for image segments
};

/// A private mapping of a member, and the number to report it by.
struct MemberMapping {
    AddressRange range;
    std::size_t index = 0;
    bool isFile = false;
};

/// The mappings of one process that relatives can share page by page, in rising order.
std::vector<MemberMapping> privateMappings(std::span<const Mapping> mappings);

/// Which clusters are image segments, for `keepsAllSets`: those that hold a private mapping of a file, and
/// what lies directly behind one, its zero-filled data. `mappings[m]` are the private mappings of member m.
std::vector<char> imageClusters(std::span<const AddressSlot> slots,
                                std::span<const std::vector<MemberMapping>> mappings);

/// The parts of every member, sorted by mapping. `mappings[m]` are the private mappings of member m.
std::vector<std::vector<SharedPart>> sharedParts(const FamilySharing& family,
                                                 std::span<const std::vector<MemberMapping>> mappings);

} // namespace tally::platform
