// What a process is charged for, from its status file.

#include "platform/linux/processes/Ledgers.h"

#include "platform/bsd_process.h"
#include "platform/linux/gather/MachineState.h"
#include "platform/linux/processes/ProcessStat.h"
#include "platform/linux/walk/Mapping.h"
#include "platform/linux/walk/Task.h"

#include <algorithm>
#include <array>
#include <cstring>
#include <optional>

namespace tally::platform {

namespace {

constexpr std::array<const char*, 2> entryNames{"page_table", "phys_tally"};
/// What VmPTE leaves out: the top-level table is a page. Larger pages map so much that it has a few entries
/// only, from a cache of the kernel's.
const std::uint64_t topLevelTable = basePage == 4096 ? basePage : 0;

/// The charges of the process that this thread read last: the usage record and the ledger that are asked one
/// after the other come from one read, so that they agree.
struct LastRead {
    std::int32_t pid = 0;
    Charges charges;
};
thread_local std::optional<LastRead> lastRead;

Charges chargesOf(const ProcessStatus& status, bool isSecondTenant) {
    Charges charges;
    if (status.hasAddressSpace) {
        charges.pageTable = isSecondTenant ? 0 : status.pageTables + topLevelTable;
        charges.physTally = status.residentAnonymous + status.residentShared + status.hugetlb +
                            status.swapped + charges.pageTable;
        charges.peak = std::max(charges.physTally, status.peakResident);
        charges.residentAnonymous = status.residentAnonymous;
    }
    return charges;
}

/// @param counted what a walk has found, instead of counters that lag.
std::optional<ProcessStatus> readExactStatus(std::int32_t pid, const std::optional<ResidentMemory>& counted) {
    std::optional<ProcessStatus> status = readProcessStatus(pid);
    if (status && counted && machineState().countersLag) {
        status->residentAnonymous = counted->anonymous;
        status->residentShared = counted->shared;
        status->swapped = counted->swapped;
    }
    return status;
}

std::optional<Charges> readChargesOfTask(std::int32_t pid) {
    const std::shared_ptr<Task> task = taskOfProcess(pid);
    const auto status = readExactStatus(pid, task ? task->resident() : std::nullopt);
    if (status && task) {
        task->noteStatus(*status);
    }
    return status ? std::optional(chargesOf(*status, task && task->isSecondTenant())) : std::nullopt;
}

} // namespace

std::optional<Charges> readCharges(std::int32_t pid, bool isSecondTenant,
                                   const std::optional<ResidentMemory>& counted) {
    const std::optional<ProcessStatus> status = readExactStatus(pid, counted);
    return status ? std::optional(chargesOf(*status, isSecondTenant)) : std::nullopt;
}

int proc_pid_rusage(std::int32_t pid, rusage_info_v5* info) {
    const std::optional<Charges> charges = readChargesOfTask(pid);
    if (!charges) {
        return -1;
    }
    lastRead = LastRead{pid, *charges};
    info->ri_phys_tally = charges->physTally;
    info->ri_lifetime_max_phys_tally = charges->peak;
    info->ri_resident_anonymous = charges->residentAnonymous;
    return 0;
}

int ledger_template(std::span<ledger_template_info> entries) {
    const std::size_t count = std::min(entries.size(), entryNames.size());
    for (std::size_t i = 0; i < count; ++i) {
        entries[i] = ledger_template_info();
        std::strcpy(entries[i].lti_name, entryNames[i]);
        std::strcpy(entries[i].lti_group, "physmem");
        std::strcpy(entries[i].lti_units, "bytes");
    }
    return static_cast<int>(count);
}

int ledger_entries(std::int32_t pid, std::span<ledger_entry_info> entries) {
    std::optional<Charges> charges;
    if (lastRead && lastRead->pid == pid) {
        charges = lastRead->charges;
        lastRead.reset();
    } else {
        charges = readChargesOfTask(pid);
    }
    if (!charges) {
        return -1;
    }
    const std::array<std::uint64_t, entryNames.size()> balances{charges->pageTable, charges->physTally};
    const std::size_t count = std::min(entries.size(), balances.size());
    for (std::size_t i = 0; i < count; ++i) {
        entries[i] = ledger_entry_info();
        entries[i].lei_balance = static_cast<std::int64_t>(balances[i]);
    }
    return static_cast<int>(count);
}

} // namespace tally::platform
