// Who the processes are: the list of pids, identity records, argument areas.
//
// The kernel is process 0. Its threads are left out everywhere: their memory is the kernel's.

#include "platform/bsd_process.h"
#include "platform/linux/io/FileInquiry.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/processes/Executable.h"
#include "platform/linux/processes/ProcessStat.h"

#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

namespace tally::platform {

namespace {

constexpr std::int32_t kernelPid = 0;

std::optional<std::vector<std::int32_t>> listPids() {
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(systemPath("/proc").c_str()), closedir);
    if (!folder) {
        return std::nullopt;
    }
    std::vector<std::int32_t> pids{kernelPid};
    errno = 0; // by which a failure differs from the end
    while (const dirent* entry = readdir(folder.get())) {
        const char* name = entry->d_name;
        const char* end = name + std::strlen(name);
        std::int32_t pid = 0;
        const auto result = std::from_chars(name, end, pid);
        if (result.ec == std::errc() && result.ptr == end && pid > 0 && !isInquirer(pid)) {
            pids.push_back(pid);
        }
    }
    if (errno != 0) {
        return std::nullopt;
    }
    std::sort(pids.begin(), pids.end());
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

} // namespace tally::platform
