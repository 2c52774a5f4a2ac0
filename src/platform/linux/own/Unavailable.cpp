// Calls that this system answers with "none".

#include "platform/dyld_inspection.h"
#include "platform/mach_task.h"
#include "platform/runekit.h"

#include <cerrno>

namespace tally::platform {

// There is no shared library cache on this system.
std::optional<dyld_shared_cache> dyld_shared_cache_for_task(mach_port_t /*task*/,
                                                            kern_return_t* process_status,
                                                            kern_return_t* snapshot_status) {
    *process_status = KERN_SUCCESS;
    *snapshot_status = KERN_SUCCESS;
    return std::nullopt;
}

// The kernel names its callers itself, so its symbols are not read for that.
std::unique_ptr<RKKernelSymbolicator> RKCreateKernelSymbolicator() { return nullptr; }

kern_return_t task_generate_corpse(mach_port_t /*task*/, mach_port_t* corpse) {
    *corpse = MACH_PORT_NULL;
    return KERN_NOT_SUPPORTED;
}

kern_return_t task_map_corpse_info_64(mach_port_t /*corpse*/, std::span<const std::byte>* buffer) {
    *buffer = {};
    return KERN_NOT_SUPPORTED;
}

kern_return_t vm_deallocate(std::span<const std::byte> /*buffer*/) { return KERN_SUCCESS; }

} // namespace tally::platform
