// The shared library cache that a task maps.

#pragma once

#include "platform/kern_return.h"

#include <array>
#include <cstdint>
#include <optional>

namespace tally::platform {

using uuid_t = std::array<std::uint8_t, 16>;

struct dyld_shared_cache {
    uuid_t uuid{};
    std::uint64_t base_address = 0;
    std::uint64_t mapped_size = 0; // bytes
    bool mapped_private = false;
};

/// Looks at the dynamic linker's state of `task`.
/// @param process_status  out: whether the state could be opened.
/// @param snapshot_status out: whether it could be read; only meaningful when the first succeeded.
/// @return the cache; nothing when the task maps none or a status is an error.
std::optional<dyld_shared_cache> dyld_shared_cache_for_task(mach_port_t task, kern_return_t* process_status,
                                                            kern_return_t* snapshot_status);

} // namespace tally::platform
