// TLSharedCache: one shared library cache, one record per distinct cache for the run.

#pragma once

#include "platform/dyld_inspection.h"

#include <cstdint>
#include <memory>

namespace tally {

struct TLSharedCache {
    std::uint32_t alignment = 4096; // bytes
    platform::uuid_t uuid{};
    std::uint64_t baseAddress = 0;
    std::uint64_t mappedSize = 0; // bytes

    /// The record of the cache that `task` maps; null when it maps none, maps one privately, or cannot be
    /// inspected (then with a message on standard error). Thread-safe.
    static std::shared_ptr<const TLSharedCache> sharedCacheForTask(platform::mach_port_t task);

    bool contains(std::uint64_t address) const { return address - baseAddress < mappedSize; }
};

} // namespace tally
