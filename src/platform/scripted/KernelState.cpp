#include "platform/scripted/KernelState.h"

namespace tally::platform {

bool KernelState::deliver(bool InterruptHandler::*isTaken) {
    const std::lock_guard lock(mutex);
    bool wasTaken = false;
    const auto handlers = interruptHandlers; // a handler may cancel its source
    for (const auto& [source, handler] : handlers) {
        if (handler.*isTaken) {
            wasTaken = true;
            handler.call();
        }
    }
    return wasTaken;
}

bool KernelState::Fault::meets(const CallRecord& record) {
    if (record.name != call || (which.pid && record.pid != *which.pid)) {
        return false;
    }
    ++seen;
    return seen >= which.nth && seen - which.nth < which.times;
}

} // namespace tally::platform
