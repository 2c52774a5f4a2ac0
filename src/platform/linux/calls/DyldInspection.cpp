#include "platform/dyld_inspection.h"

namespace tally::platform {

// There is no shared library cache on this system.
std::optional<dyld_shared_cache> dyld_shared_cache_for_task(mach_port_t /*task*/,
                                                            kern_return_t* process_status,
                                                            kern_return_t* snapshot_status) {
    *process_status = KERN_SUCCESS;
    *snapshot_status = KERN_SUCCESS;
    return std::nullopt;
}

} // namespace tally::platform
