// Crash information of a corpse: a kcdata buffer, read item by item.
//
// Nothing outside the buffer is ever read, whatever its sizes say.

#pragma once

#include "platform/kern_return.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <span>

namespace tally {

struct KcdataItem {
    std::uint32_t type = 0; // of an array whatever its padding
    std::span<const std::byte> payload;
};

using KcdataItemHandler = std::function<void(const KcdataItem&)>;

/// Calls `handler` for each item of `buffer`, the begin marker first, up to the end marker or to an item that
/// does not fit. @return whether the buffer begins with a begin marker.
bool enumerateKcdata(std::span<const std::byte> buffer, const KcdataItemHandler& handler);

/// The same for the crash information of `corpse`; false as well when it has none.
bool enumerateCorpseKcdata(platform::mach_port_t corpse, const KcdataItemHandler& handler);

} // namespace tally
