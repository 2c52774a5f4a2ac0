// View: what the counts of a mapping tell, by the accounting switch "vm.self_region_tally".

#pragma once

#include <cstdint>

namespace tally::platform {

enum class View : std::uint8_t {
    charged, // what the task is charged for: the switch is on
    object,  // what the VM object holds, whoever uses it
};

} // namespace tally::platform
