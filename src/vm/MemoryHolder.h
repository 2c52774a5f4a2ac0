// MemoryHolder: what the region and object model needs to know of a process.

#pragma once

#include <cstdint>

namespace tally {

class MemoryHolder {
  public:
    virtual ~MemoryHolder() = default;
    virtual std::int32_t pid() const = 0;
    virtual std::uint64_t pageSize() const = 0; // bytes
    /// Whether its memory is broken down the way the kernel charges it to the task.
    virtual bool breakDownPhysTally() const = 0;
};

} // namespace tally
