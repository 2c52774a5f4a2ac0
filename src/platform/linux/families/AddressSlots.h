// AddressSlots: the address ranges in which related processes have private mappings, cut at every border.
//
// Relatives' mappings drift apart as they grow, so they are matched by overlap: mappings that overlap one
// another belong to one cluster. Between two neighbouring borders every process has one mapping or none: a
// slot.

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace tally::platform {

struct AddressSlot {
    std::uint64_t start = 0;
    std::uint64_t end = 0;
    std::size_t cluster = 0;        // number, rising by address
    std::uint64_t clusterStart = 0; // address
};

/// Cuts the union of `ranges` (in any order) at all their borders. The slots come in rising order.
std::vector<AddressSlot> addressSlots(std::span<const AddressRange> ranges);

} // namespace tally::platform
