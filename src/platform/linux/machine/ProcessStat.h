// /proc/PID/stat and /proc/PID/status, decoded.

#pragma once

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

struct ProcessStat {
    std::int32_t pid = 0;
    std::string comm; // command name, any bytes
    char state = '?';
    std::int32_t parent = 0;
    std::uint32_t flags = 0;
    std::int64_t threads = 0;
    std::uint64_t startTicks = 0; // clock ticks since boot
    std::int32_t exitSignal = 0;  // that its parent gets
    // Addresses: start and end of code, stack, start and end of data, break. 0 without an address space, and
    // 1 for the first where tracing is not permitted.
    std::array<std::uint64_t, 6> layout{};

    static constexpr std::uint32_t kernelThread = 0x00200000;
    bool isKernelThread() const { return (flags & kernelThread) != 0; }
    /// No process of its own: the id of a thread opens a folder too, and only a process signals its end.
    bool isThread() const { return exitSignal < 0; }
    /// Whether the kernel shows who asks what is in the process's memory.
    bool showsMemory() const { return layout[0] != 1; }
    /// Ended, with no thread left that lives on without its leader.
    bool isZombie() const { return (state == 'Z' || state == 'X') && threads <= 1; }
};

/// Decodes the text of a stat file; absent when it is none.
std::optional<ProcessStat> decodeStat(std::string_view text);

/// Reads /proc/PID/stat; absent when that fails, with errno.
std::optional<ProcessStat> readProcessStat(std::int32_t pid);

/// Figures of a status file; sizes in bytes, 0 where the kernel names none.
struct ProcessStatus {
    std::uint64_t peakResident = 0;      // VmHWM
    std::uint64_t locked = 0;            // VmLck
    std::uint64_t residentAnonymous = 0; // RssAnon
    std::uint64_t residentShared = 0;    // RssShmem
    std::uint64_t pageTables = 0;        // VmPTE
    std::uint64_t swapped = 0;           // VmSwap
    std::uint64_t hugetlb = 0;           // HugetlbPages
    bool hasAddressSpace = false;        // the process has not ended
};

ProcessStatus decodeStatus(std::string_view text);

/// Reads /proc/PID/status, of another thread where the first has ended; absent when that fails, with errno.
std::optional<ProcessStatus> readProcessStatus(std::int32_t pid);

/// Bytes of anonymous memory that process `pid` has in memory, by the counters that smaller files tell too;
/// absent with errno.
std::optional<std::uint64_t> readResidentAnonymous(std::int32_t pid);

/// The folders of the threads of process `pid` but the first: a leader that ended before its threads shows no
/// memory and no addresses, while they do.
std::vector<std::string> threadFolders(std::int32_t pid);

} // namespace tally::platform
