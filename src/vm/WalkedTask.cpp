#include "vm/WalkedTask.h"

#include "base/Format.h"
#include "platform/bsd_process.h"

#include <cerrno>
#include <system_error>

namespace tally {

using namespace platform;

void WalkedTask::reportWarning(std::string_view message) const {
    const int error = errno;
    std::string text =
        displayString + ": " + std::string(message) + " - " + std::generic_category().message(error);
    printLineToStandardError(text);
    addWarning(std::move(text));
}

void WalkedTask::recordRegionError(kern_return_t status) const {
    const char* ending = "";
    if (isAlive) {
        proc_bsdshortinfo info;
        if (proc_pidinfo(pid, &info) == sizeof info) {
            ending = info.pbsi_status == SZOMB ? " (zombie)" : "";
        } else if (errno == ESRCH) {
            ending = " (process exited)";
        }
    }
    std::string text = displayString + ": " + mach_error_string(status) + ending;
    if (*ending != '\0') {
        addWarning(std::move(text));
    } else {
        addError(std::move(text));
    }
}

} // namespace tally
