#include "platform/kern_return.h"

#include <cstdio>

namespace tally::platform {

const char* mach_error_string(kern_return_t status) {
    switch (status) {
    case KERN_SUCCESS:
        return "success";
    case KERN_INVALID_ADDRESS:
        return "invalid address";
    case KERN_NO_SPACE:
        return "no space available";
    case KERN_INVALID_ARGUMENT:
        return "invalid argument";
    case KERN_FAILURE:
        return "failure";
    case KERN_NO_ACCESS:
        return "no access";
    case KERN_RIGHT_EXISTS:
        return "already traced";
    case KERN_TERMINATED:
        return "terminated";
    case KERN_NOT_SUPPORTED:
        return "operation not supported";
    case KERN_OPERATION_TIMED_OUT:
        return "timed out: its threads did not hold still";
    default:
        return "unknown error code";
    }
}

void mach_error(const char* label, kern_return_t status) {
    std::fprintf(stderr, "%s: %s\n", label, mach_error_string(status));
}

} // namespace tally::platform
