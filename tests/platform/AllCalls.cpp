// Every platform function, named once: a platform that forgets one does not link.

#include "platform/benchlog.h"
#include "platform/bsd_process.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/dyld_inspection.h"
#include "platform/gather.h"
#include "platform/kern_return.h"
#include "platform/mach_kernel_memory.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"
#include "platform/output_file.h"
#include "platform/quarry.h"
#include "platform/runekit.h"
#include "platform/system.h"

#include <tuple>

namespace tally::platform {

[[gnu::used]] const std::tuple allCalls{
    &blwriter_open,
    &blwriter_set_description,
    &blwriter_set_primary_metric,
    &blwriter_new_group,
    &blwriter_new_value,
    &blwriter_record_variable_str,
    &blwriter_record_label_str,
    &blwriter_record_tag,
    &blwriter_close,
    &blwriter_discard,
    &proc_listallpids,
    static_cast<int (*)(std::int32_t, proc_bsdinfo*)>(&proc_pidinfo),
    static_cast<int (*)(std::int32_t, proc_bsdshortinfo*)>(&proc_pidinfo),
    &proc_pid_rusage,
    &proc_get_dirty,
    &proc_regionfilename,
    &ledger_template,
    &ledger_entries,
    &sysctl_argmax,
    &sysctl_procargs2,
    &sysctlbyname_read,
    &sysctlbyname_write,
    &sysctl_owned_vmobjects,
    &vm_kernel_page_size,
    &mach_get_times,
    &mach_timebase_info,
    &clock_uptime_raw_approx_ns,
    &iso8601LocalDate,
    &dispatch_apply,
    &dispatch_source_interrupt,
    &restoreDefaultInterruptAction,
    &dispatch_source_timer,
    &dyld_shared_cache_for_task,
    &task_take_notices,
    &task_has_relatives,
    &mach_error_string,
    &mach_error,
    &mach_memory_info,
    &copyLoadedModuleIdentifiers,
    &task_read_for_pid,
    &task_generate_corpse,
    &task_map_corpse_info_64,
    &vm_deallocate,
    &mach_port_retain,
    &mach_port_deallocate,
    &mach_vm_region,
    &mach_vm_region_recurse,
    &mach_vm_page_range_query,
    &mach_vm_next_page,
    &mach_vm_purgable_get_state,
    &QRYRegionTypeDescriptionForTag,
    &QRYTagForRegionTypeDescription,
    &QRYDirectedGraphWithData,
    &QRYDataWithSnapshot,
    &QRYHostArchitecture,
    &QRYArchitectureOf,
    &RKForeachSymbolOwner,
    &RKResolvedPath,
    &RKCreateKernelSymbolicator,
    &OutputFile::open,
    &fileInMemory,
    &isOneFile,
    &OptionScanner::next,
    &OptionScanner::argument,
    &OptionScanner::index,
    &prepareOwnProcess,
    &endWithClosedPipe,
    &standardOutputIsTerminal,
    &effectiveUserId,
    &ownPid,
    &hasInternalContent,
};

void makeAndDestroyEveryClass(int argc, char** argv) {
    const GatherScope gather;
    const StandardOutput output;
    const OptionScanner scanner(argc, argv, "", {});
}

} // namespace tally::platform
