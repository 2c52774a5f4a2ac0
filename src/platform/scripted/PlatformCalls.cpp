#include "platform/scripted/PlatformCalls.h"

#include <algorithm>
#include <array>
#include <span>
#include <stdexcept>

namespace tally::platform {

namespace {

// A fault for a call that is in neither list would never happen, and its test would prove nothing.
constexpr std::array<std::string_view, 35> callsThatCanFail{
    "QRYRegionTypeDescriptionForTag",
    "RKCreateKernelSymbolicator",
    "RKForeachSymbolOwner",
    "RKResolvedPath",
    "copyLoadedModuleIdentifiers",
    "dispatch_source_interrupt",
    "dispatch_source_timer",
    "dyld_shared_cache_for_task",
    "ledger_entries",
    "ledger_template",
    "mach_get_times",
    "mach_memory_info",
    "mach_port_deallocate",
    "mach_port_retain",
    "mach_vm_next_page",
    "mach_vm_page_range_query",
    "mach_vm_purgable_get_state",
    "mach_vm_region",
    "mach_vm_region_recurse",
    "proc_get_dirty",
    "proc_listallpids",
    "proc_pid_rusage",
    "proc_pidinfo",
    "proc_pidshortinfo",
    "proc_regionfilename",
    "sysctl_argmax",
    "sysctl_owned_vmobjects",
    "sysctl_procargs2",
    "sysctlbyname_read",
    "sysctlbyname_write",
    "task_generate_corpse",
    "task_map_corpse_info_64",
    "task_read_for_pid",
    "task_take_notices",
    "vm_deallocate",
};
constexpr std::array<std::string_view, 16> callsThatCannot{
    "GatherScope",
    "QRYTagForRegionTypeDescription",
    "clock_uptime_raw_approx_ns",
    "effectiveUserId",
    "endWithClosedPipe",
    "fileInMemory",
    "hasInternalContent",
    "mach_timebase_info",
    "mapsFile",
    "ownPid",
    "prepareOwnProcess",
    "restoreDefaultInterruptAction",
    "setTimer",
    "standardOutputIsTerminal",
    "task_has_relatives",
    "vm_kernel_page_size",
};

bool isOneOf(std::span<const std::string_view> names, std::string_view call) {
    return std::find(names.begin(), names.end(), call) != names.end();
}

} // namespace

void requireCallName(std::string_view call, bool canFail) {
    if (!isOneOf(callsThatCanFail, call) && (canFail || !isOneOf(callsThatCannot, call))) {
        throw std::invalid_argument(std::string(call) + (canFail ? " cannot fail" : " is no platform call"));
    }
}

} // namespace tally::platform
