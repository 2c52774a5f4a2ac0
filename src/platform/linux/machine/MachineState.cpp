#include "platform/linux/machine/MachineState.h"

#include "platform/linux/io/Gather.h"
#include "platform/linux/io/Pages.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"

#include <sys/sysinfo.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <limits>
#include <optional>
#include <thread>
#include <utility>

namespace tally::platform {

namespace {

/// The number that stands behind `key` at the start of a line; 0 when there is none.
std::int64_t numberOf(std::string_view text, std::string_view key) {
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        if (line.starts_with(key)) {
            line.remove_prefix(key.size());
            std::int64_t number = 0;
            if (takeNumber(line, &number)) {
                return number;
            }
        }
    }
    return 0;
}

/// Counters lag by what processors keep to themselves: less than this is nothing.
std::int64_t noisePages() {
    constexpr std::int64_t ofOneProcessor = 16;
    return ofOneProcessor * std::max<std::int64_t>(std::thread::hardware_concurrency(), 1);
}

/// The same without a file; true when that cannot be had either.
bool swapInUseBySystem() {
    struct sysinfo system {};
    return sysinfo(&system) != 0 || system.totalswap != system.freeswap;
}

/// Before 6.2 each thread kept what it had touched last to itself.
bool countersLag() {
    utsname system{};
    if (uname(&system) != 0) {
        return false;
    }
    std::string_view release = system.release;
    int major = 0;
    int minor = 0;
    const bool isTold = takeNumber(release, &major) && takeChar(release, '.') && takeNumber(release, &minor);
    return isTold && std::pair(major, minor) < std::pair(6, 2);
}

MachineState readMachineState() {
    const std::optional<std::string> meminfo = readSystemFile(systemPath("/proc/meminfo"));
    const std::optional<std::string> vmstat = readSystemFile(systemPath("/proc/vmstat"));
    const std::optional<std::string> merged = readSystemFile(systemPath("/sys/kernel/mm/ksm/pages_shared"));
    const bool cannotMerge = !merged && errno == ENOENT;
    return {.swapInUse = meminfo ? decodeSwapInUse(*meminfo) : swapInUseBySystem(),
            .mergesPages = merged ? numberOf(*merged, "") != 0 : !cannotMerge,
            .tellsMergedPages = access(systemPath("/proc/self/ksm_merging_pages").c_str(), F_OK) == 0,
            .countersLag = countersLag(),
            .lazyFree = vmstat ? decodeLazyFree(*vmstat) : std::numeric_limits<std::uint64_t>::max()};
}

/// That of a gather.
struct GatheredState {
    MachineState state = readMachineState();
};

} // namespace

std::uint64_t decodeLazyFree(std::string_view vmstat) {
    const std::int64_t onFileLists =
        numberOf(vmstat, "nr_inactive_file ") + numberOf(vmstat, "nr_active_file ");
    const std::int64_t filePages = numberOf(vmstat, "nr_file_pages ") - numberOf(vmstat, "nr_shmem ") -
                                   numberOf(vmstat, "nr_swapcached ");
    const std::int64_t surplus = onFileLists - filePages;
    return surplus > noisePages() ? static_cast<std::uint64_t>(surplus) * basePage : 0;
}

bool decodeSwapInUse(std::string_view meminfo) {
    return numberOf(meminfo, "SwapTotal:") != numberOf(meminfo, "SwapFree:");
}

MachineState machineState() {
    const GatheredState* gathered = Gather::table<GatheredState>();
    return gathered != nullptr ? gathered->state : readMachineState();
}

} // namespace tally::platform
