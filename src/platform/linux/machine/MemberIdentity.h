// Who a process is: a pid that is used again is another one's.

#pragma once

#include <cstdint>

namespace tally::platform {

struct MemberIdentity {
    std::int32_t pid = 0;
    std::uint64_t startTicks = 0; // after boot, in clock ticks
};

} // namespace tally::platform
