#include "vm/PhysTallyCollection.h"

#include "platform/bsd_process.h"

#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstdio>

namespace tally {

using namespace platform;

namespace {

constexpr const char* switchName = "vm.self_region_tally";

enum class Switch : std::uint8_t { off = 0, on = 1, unknown = 2 };

std::atomic<Switch>& cachedSwitch() {
    static std::atomic<Switch> state = Switch::unknown;
    return state;
}

} // namespace

bool physTallyCollectionEnabled() {
    Switch state = cachedSwitch().load();
    if (state == Switch::unknown) {
        std::int32_t value = 0;
        if (sysctlbyname_read(switchName, &value) != 0) {
            if (errno != ENOENT) {
                std::perror("Unable to retrieve status of physical tally data collection");
            }
            value = 0;
        }
        state = value != 0 ? Switch::on : Switch::off;
        cachedSwitch() = state;
    }
    return state == Switch::on;
}

void setPhysTallyCollectionEnabled(int value) {
    if (sysctlbyname_write(switchName, value) != 0 && errno != ENOENT) {
        std::perror("Unable to configure physical tally data collection");
    }
    cachedSwitch() = Switch::unknown;
}

} // namespace tally
