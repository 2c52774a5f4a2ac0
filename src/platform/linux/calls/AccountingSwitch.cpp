#include "platform/linux/calls/AccountingSwitch.h"

#include "platform/bsd_process.h"

#include <atomic>
#include <cerrno>
#include <string_view>

namespace tally::platform {

namespace {

std::atomic<std::int32_t> switchValue = 0;

bool isSwitch(const char* name) {
    errno = ENOENT;
    return name == std::string_view("vm.self_region_tally");
}

} // namespace

View currentView() { return switchValue != 0 ? View::charged : View::object; }

int sysctlbyname_read(const char* name, std::int32_t* value) {
    if (!isSwitch(name)) {
        return -1;
    }
    *value = switchValue;
    return 0;
}

int sysctlbyname_write(const char* name, std::int32_t value) {
    if (!isSwitch(name)) {
        return -1;
    }
    switchValue = value;
    return 0;
}

} // namespace tally::platform
