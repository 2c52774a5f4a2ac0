// Rights to tasks: ports of live processes and of corpses.

#pragma once

#include "platform/kern_return.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <utility>

namespace tally::platform {

/// Makes a reading right to the task of process `pid`. The right stands for that very process: when its pid
/// is used again, the task is dead. Thread-safe, as are all calls of this header.
/// @return KERN_SUCCESS; KERN_FAILURE when there is no such process; KERN_NO_ACCESS when its mappings may
///         not be read. `*task` is MACH_PORT_NULL then.
kern_return_t task_read_for_pid(std::int32_t pid, mach_port_t* task);

/// Makes a corpse of `task`: a copy that no longer changes, with its crash information. The task runs on.
/// @return KERN_SUCCESS; KERN_TERMINATED when it has ended; KERN_RIGHT_EXISTS while somebody else traces it;
///         KERN_NO_ACCESS; KERN_OPERATION_TIMED_OUT when it could not be made to hold still;
///         KERN_INVALID_ARGUMENT when the port is not a task's. `*corpse` is MACH_PORT_NULL then.
kern_return_t task_generate_corpse(mach_port_t task, mach_port_t* corpse);

/// Maps the crash information of a corpse, a kcdata buffer, for reading.
/// @param buffer out: its bytes, valid until vm_deallocate of it.
kern_return_t task_map_corpse_info_64(mach_port_t corpse, std::span<const std::byte>* buffer);

/// Gives back a buffer that a kernel call returned.
kern_return_t vm_deallocate(std::span<const std::byte> buffer);

/// Adds a reference to the right that `port` names.
kern_return_t mach_port_retain(mach_port_t port);

/// Gives up one reference to the right that `port` names; the last one releases what is kept for it.
kern_return_t mach_port_deallocate(mach_port_t port);

/// One reference to a port right, given up when the holder goes away.
class PortRight {
  public:
    PortRight() = default;
    /// Takes over a reference that the caller holds.
    explicit PortRight(mach_port_t name) : name_(name) {}
    PortRight(PortRight&& other) noexcept : name_(std::exchange(other.name_, MACH_PORT_NULL)) {}
    PortRight& operator=(PortRight&& other) noexcept {
        std::swap(name_, other.name_);
        return *this;
    }
    PortRight(const PortRight&) = delete;
    PortRight& operator=(const PortRight&) = delete;
    ~PortRight() {
        if (name_ != MACH_PORT_NULL) {
            mach_port_deallocate(name_);
        }
    }

    mach_port_t name() const { return name_; }

  private:
    mach_port_t name_ = MACH_PORT_NULL;
};

} // namespace tally::platform
