// BSD process information, from the task records.

#include "platform/bsd_process.h"
#include "platform/scripted/Answer.h"

#include <algorithm>
#include <cstring>
#include <string_view>

namespace tally::platform {

namespace {

constexpr std::string_view accountingSwitch = "vm.self_region_tally";

/// Copies `text` into a field that need not end in a NUL.
template <std::size_t N>
void fillField(char (&field)[N], std::string_view text) {
    std::copy_n(text.begin(), std::min(text.size(), N), field);
}

std::string_view commandName(const ScriptedTask& task) { return task.comm ? *task.comm : task.name; }

std::uint32_t statusOf(const ScriptedTask& task) { return task.state == TaskState::zombie ? SZOMB : SRUN; }

std::string argumentArea(const ScriptedTask& task) {
    if (task.argumentArea) {
        return *task.argumentArea;
    }
    const auto argumentCount = static_cast<std::uint32_t>(task.arguments.size());
    std::string area(sizeof argumentCount, '\0');
    std::memcpy(area.data(), &argumentCount, sizeof argumentCount);
    area += task.path.empty() ? "/bin/" + task.name : task.path;
    area.append(8 - area.size() % 8, '\0'); // one NUL or more, then the arguments
    for (const std::string& argument : task.arguments) {
        area += argument;
        area += '\0';
    }
    return area;
}

} // namespace

int proc_listallpids(std::span<std::int32_t> pids) {
    const Answer answer("proc_listallpids", -1, {pids.size()});
    if (answer.fault != 0) {
        return Answer::refuse(answer.fault);
    }
    std::size_t count = 0;
    for (const auto& [pid, task] : answer.state.tasksByPid) {
        if (task->state == TaskState::gone) {
            continue;
        }
        if (count < pids.size()) {
            pids[count] = pid;
        } else if (!pids.empty()) {
            break;
        }
        ++count;
    }
    return static_cast<int>(count);
}

int proc_pidinfo(std::int32_t pid, proc_bsdinfo* info) {
    const Answer answer("proc_pidinfo", pid);
    const ScriptedTask* task = answer.kernel.findTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
        return 0;
    }
    *info = {};
    info->pbi_flags = task->flags;
    info->pbi_status = statusOf(*task);
    info->pbi_pid = task->pid;
    info->pbi_ppid = task->parent;
    fillField(info->pbi_comm, commandName(*task));
    fillField(info->pbi_name, task->name);
    return sizeof *info;
}

int proc_pidinfo(std::int32_t pid, proc_bsdshortinfo* info) {
    const Answer answer("proc_pidshortinfo", pid);
    const ScriptedTask* task = answer.kernel.findTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
        return 0;
    }
    *info = {};
    info->pbsi_pid = task->pid;
    info->pbsi_ppid = task->parent;
    info->pbsi_status = statusOf(*task);
    fillField(info->pbsi_comm, commandName(*task));
    return sizeof *info;
}

int proc_pid_rusage(std::int32_t pid, rusage_info_v5* info) {
    const Answer answer("proc_pid_rusage", pid);
    const ScriptedTask* task = answer.kernel.findTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        return Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
    }
    *info = task->state == TaskState::zombie ? rusage_info_v5() : task->usage; // a zombie has no memory
    return 0;
}

int proc_get_dirty(std::int32_t pid, std::uint32_t* flags) {
    const Answer answer("proc_get_dirty", pid);
    const ScriptedTask* task = answer.kernel.findTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        return Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
    }
    *flags = task->dirtyFlags;
    return 0;
}

int proc_regionfilename(std::int32_t pid, std::uint64_t address, std::span<char> buffer) {
    const Answer answer("proc_regionfilename", pid, {address, buffer.size()});
    const ScriptedTask* task = answer.runningTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        return Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
    }
    const ScriptedMapping* mapping = task->findMapping(address, ~std::uint32_t{0}).mapping;
    if (mapping == nullptr || address < *mapping->start) {
        return 0;
    }
    const std::size_t length = std::min(mapping->file.size(), buffer.size());
    std::copy_n(mapping->file.begin(), length, buffer.begin());
    return static_cast<int>(length);
}

int ledger_template(std::span<ledger_template_info> entries) {
    const Answer answer("ledger_template", -1, {entries.size()});
    if (answer.fault != 0) {
        return Answer::refuse(answer.fault);
    }
    const auto& names = answer.kernel.ledgerTemplate;
    const std::size_t count = std::min(names.size(), entries.size());
    for (std::size_t i = 0; i < count; ++i) {
        entries[i] = {};
        fillField(entries[i].lti_name, names[i]);
        fillField(entries[i].lti_group, "physmem");
        fillField(entries[i].lti_units, "bytes");
    }
    return static_cast<int>(count);
}

int ledger_entries(std::int32_t pid, std::span<ledger_entry_info> entries) {
    const Answer answer("ledger_entries", pid, {entries.size()});
    const ScriptedTask* task = answer.kernel.findTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        return Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
    }
    const auto& names = answer.kernel.ledgerTemplate;
    const std::size_t count = std::min(names.size(), entries.size());
    for (std::size_t i = 0; i < count; ++i) {
        const auto balance = task->ledger.find(names[i]);
        entries[i] = {};
        entries[i].lei_balance = balance == task->ledger.end() ? 0 : balance->second;
    }
    return static_cast<int>(count);
}

int sysctl_argmax(std::uint64_t* size) {
    const Answer answer("sysctl_argmax");
    if (answer.fault != 0) {
        return Answer::refuse(answer.fault);
    }
    *size = answer.kernel.argmax;
    return 0;
}

std::ptrdiff_t sysctl_procargs2(std::int32_t pid, std::span<char> area) {
    const Answer answer("sysctl_procargs2", pid, {area.size()});
    const ScriptedTask* task = answer.runningTask(pid);
    if (answer.fault != 0 || task == nullptr) {
        return Answer::refuse(answer.fault != 0 ? answer.fault : ESRCH);
    }
    const std::string whole = argumentArea(*task);
    const std::size_t length = std::min(whole.size(), area.size());
    std::copy_n(whole.begin(), length, area.begin());
    return static_cast<std::ptrdiff_t>(length);
}

int sysctlbyname_read(const char* name, std::int32_t* value) {
    const Answer answer("sysctlbyname_read", -1, {}, name);
    if (answer.fault != 0) {
        return Answer::refuse(answer.fault);
    }
    if (name != accountingSwitch || !answer.kernel.selfRegionTally) {
        return Answer::refuse(ENOENT);
    }
    *value = *answer.kernel.selfRegionTally;
    return 0;
}

int sysctlbyname_write(const char* name, std::int32_t value) {
    const Answer answer("sysctlbyname_write", -1, {static_cast<std::uint32_t>(value)}, name);
    if (answer.fault != 0) {
        return Answer::refuse(answer.fault);
    }
    if (name != accountingSwitch || !answer.kernel.selfRegionTally) {
        return Answer::refuse(ENOENT);
    }
    answer.kernel.selfRegionTally = value;
    return 0;
}

std::optional<std::vector<owned_vmobject>> sysctl_owned_vmobjects(std::uint32_t task) {
    const Answer answer("sysctl_owned_vmobjects", PortName{task});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr || !scripted->owned) {
        errno = answer.fault != 0 ? answer.fault : scripted == nullptr ? ESRCH : ENOENT;
        return std::nullopt;
    }
    return scripted->owned;
}

std::uint64_t vm_kernel_page_size() { return Answer("vm_kernel_page_size").kernel.pageSize; }

} // namespace tally::platform
