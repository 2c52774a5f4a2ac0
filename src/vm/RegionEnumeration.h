// What an enumeration of a task's mappings hands to its consumer.

#pragma once

#include "platform/mach_vm.h"

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

namespace tally {

/// One mapping as its source describes it.
struct EnumeratedRegion {
    std::uint64_t start = 0;
    std::uint64_t size = 0; // bytes
    platform::vm_region_submap_info_64 info;
    int purgeState = platform::VM_PURGABLE_DENY;
    std::optional<std::string> fileName;
    std::optional<std::string> presetName;
    bool verbose = false;

    std::uint64_t end() const { return start + size; }
};

/// Takes one mapping; true stops the enumeration.
using RegionCallback = std::function<bool(const EnumeratedRegion&)>;

} // namespace tally
