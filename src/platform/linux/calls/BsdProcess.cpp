// What is told of processes by pid: who they are, what they are charged for, what their mappings show.
//
// The kernel is process 0. Its threads are left out everywhere: their memory is the kernel's.

#include "platform/bsd_process.h"
#include "platform/linux/calls/Task.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/objects/Executable.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/owned/OwnedObjects.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace tally::platform {

namespace {

constexpr std::int32_t kernelPid = 0;

/// Every process but those that ask files for this one; absent with errno.
std::optional<std::vector<std::int32_t>> listPids() {
    std::optional<std::vector<std::int32_t>> pids = listNumbered(systemPath("/proc"));
    if (pids) {
        std::erase_if(*pids, [](std::int32_t pid) { return pid <= 0 || isInquirer(pid); });
        pids->insert(pids->begin(), kernelPid);
    }
    return pids;
}

/// Reads the stat record of a process proper; absent with errno for what is none.
std::optional<ProcessStat> readUserProcess(std::int32_t pid) {
    std::optional<ProcessStat> stat = readProcessStat(pid);
    if (stat && (stat->isKernelThread() || stat->isThread())) {
        errno = ESRCH;
        return std::nullopt;
    }
    return stat;
}

/// The last component of argv[0] up to its first blank or colon: what a server that retitles itself goes by.
std::string nameFromArguments(std::int32_t pid, const std::string& fallback) {
    const std::string arguments = readSystemRecord(processFolder(pid) + "/cmdline").value_or("");
    std::string_view first = std::string_view(arguments).substr(0, arguments.find('\0'));
    first = first.substr(0, first.find_first_of(" :"));
    first.remove_prefix(first.rfind('/') + 1);
    return first.empty() ? fallback : std::string(first);
}

constexpr std::array<const char*, 2> entryNames{"page_table", "phys_tally"};

std::optional<Charges> readChargesOfTask(std::int32_t pid, Task* task) {
    const auto status = readExactStatus(pid, task == nullptr ? std::nullopt : task->resident());
    if (status && task != nullptr) {
        task->noteStatus(*status);
    }
    return status ? std::optional(chargesOf(*status, task != nullptr && task->isSecondTenant()))
                  : std::nullopt;
}

template <std::size_t Size>
void copyName(char (&field)[Size], std::string_view name) {
    std::memcpy(field, name.data(), std::min(name.size(), Size));
}

} // namespace

int proc_listallpids(std::span<std::int32_t> pids) {
    const std::optional<std::vector<std::int32_t>> all = listPids();
    if (!all) {
        return -1;
    }
    if (pids.empty()) {
        return static_cast<int>(all->size());
    }
    const std::size_t count = std::min(all->size(), pids.size());
    std::copy_n(all->begin(), count, pids.begin());
    return static_cast<int>(count);
}

int proc_pidinfo(std::int32_t pid, proc_bsdinfo* info) {
    if (pid == kernelPid) {
        *info = proc_bsdinfo();
        info->pbi_flags = PROC_FLAG_SYSTEM | (sizeof(void*) == 8 ? PROC_FLAG_LP64 : 0);
        info->pbi_status = SRUN;
        copyName(info->pbi_comm, "kernel");
        copyName(info->pbi_name, "kernel");
        return sizeof(proc_bsdinfo);
    }
    const std::optional<ProcessStat> stat = readUserProcess(pid);
    if (!stat) {
        return 0;
    }
    *info = proc_bsdinfo();
    info->pbi_flags = is64bitProgram(*stat) ? PROC_FLAG_LP64 : 0;
    info->pbi_status = stat->isZombie() ? SZOMB : SRUN;
    info->pbi_pid = static_cast<std::uint32_t>(pid);
    info->pbi_ppid = static_cast<std::uint32_t>(stat->parent);
    copyName(info->pbi_comm, stat->comm);
    // Readers ask for the argument area first: only where that is refused is the name needed.
    copyName(info->pbi_name, stat->showsMemory() ? stat->comm : nameFromArguments(pid, stat->comm));
    return sizeof(proc_bsdinfo);
}

int proc_pidinfo(std::int32_t pid, proc_bsdshortinfo* info) {
    const std::optional<ProcessStat> stat = readUserProcess(pid);
    if (!stat) {
        return 0;
    }
    *info = proc_bsdshortinfo();
    info->pbsi_pid = static_cast<std::uint32_t>(pid);
    info->pbsi_ppid = static_cast<std::uint32_t>(stat->parent);
    info->pbsi_status = stat->isZombie() ? SZOMB : SRUN;
    copyName(info->pbsi_comm, stat->comm);
    return sizeof(proc_bsdshortinfo);
}

int proc_get_dirty(std::int32_t /*pid*/, std::uint32_t* flags) {
    *flags = 0; // nothing is tracked for idle exit here
    return 0;
}

int sysctl_argmax(std::uint64_t* size) {
    const long bytes = sysconf(_SC_ARG_MAX);
    if (bytes <= 0) {
        return -1;
    }
    *size = static_cast<std::uint64_t>(bytes);
    return 0;
}

std::ptrdiff_t sysctl_procargs2(std::int32_t pid, std::span<char> area) {
    const std::optional<std::string> link = executableLink(pid);
    const std::optional<std::string> arguments = readSystemRecord(processFolder(pid) + "/cmdline");
    if (!link || !arguments) {
        errno = errno == ENOENT ? ESRCH : errno;
        return -1;
    }
    // Readers look for the path behind the NULs of the count, so the count is kept below 256.
    const auto count = static_cast<std::int32_t>(
        std::min<std::ptrdiff_t>(std::count(arguments->begin(), arguments->end(), '\0'), 255));
    std::string text(reinterpret_cast<const char*>(&count), sizeof(count));
    text += executablePath(pid, *link);
    text += '\0';
    text += *arguments;
    const std::size_t length = std::min(text.size(), area.size());
    std::memcpy(area.data(), text.data(), length);
    return static_cast<std::ptrdiff_t>(length);
}

int proc_pid_rusage(std::int32_t pid, rusage_info_v5* info) {
    const std::shared_ptr<Task> task = taskOfProcess(pid);
    const std::optional<Charges> charges = readChargesOfTask(pid, task.get());
    if (!charges) {
        return -1;
    }
    if (task) {
        task->noteCharges(*charges);
    }
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
    const std::shared_ptr<Task> task = taskOfProcess(pid);
    std::optional<Charges> charges = task ? task->takeCharges() : std::nullopt;
    if (!charges) {
        charges = readChargesOfTask(pid, task.get());
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

int proc_regionfilename(std::int32_t pid, std::uint64_t address, std::span<char> buffer) {
    const std::shared_ptr<Task> task = taskOfProcess(pid);
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task ? task->walk(&status) : nullptr;
    const Piece* piece = walk == nullptr ? nullptr : walk->pieceAt(address);
    if (piece == nullptr || piece->start > address || !piece->externalPager) {
        return 0;
    }
    const std::string& name = walk->mappingOf(*piece).name;
    const std::size_t length = std::min(name.size(), buffer.size());
    std::memcpy(buffer.data(), name.data(), length);
    return static_cast<int>(length);
}

std::optional<std::vector<owned_vmobject>> sysctl_owned_vmobjects(std::uint32_t port) {
    const std::shared_ptr<Task> task = taskOfPort(port);
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task ? task->walk(&status) : nullptr;
    if (walk == nullptr) {
        errno = task ? ENOENT : ESRCH; // why a task cannot be walked is for the walk to say
        return std::nullopt;
    }
    std::vector<std::string> notes;
    std::optional<OwnedObjects> objects;
    {
        const NoteTaker taker(notes);
        objects = ownedObjectsOf(task->identity(), walk->mappings(), walk->folder());
    }
    if (!objects) {
        return std::nullopt;
    }
    task->addNotices(std::move(notes));
    std::vector<owned_vmobject> list;
    for (const auto& [id, object] : *objects) {
        list.push_back(object);
    }
    return list;
}

std::uint64_t vm_kernel_page_size() { return basePage; }

} // namespace tally::platform
