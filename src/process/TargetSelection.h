// Target selection: from what the user typed to pids and process objects.
//
// Every operation works on one snapshot of the system's process list, taken at its start.

#pragma once

#include "platform/bsd_process.h"
#include "process/TLProcess.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <vector>

namespace tally {

/// The name under which a target was found; absent is the no-name marker of a target named by its pid.
using TLTargetName = std::optional<std::string>;
using TLTargetPids = std::map<std::int32_t, TLTargetName>;
/// Keyed by pid, or by the hash of a snapshot's path.
using TLProcessTable = std::map<std::uint64_t, std::shared_ptr<TLProcess>>;
using TLPidSet = std::set<std::int32_t>;

/// The identity records of every process that could be read, in the order the kernel lists them; absent when
/// the list cannot be obtained.
std::optional<std::vector<platform::proc_bsdinfo>> copyAllBsdInfos();

/// A process that was asked for, or why it could not be read.
struct TLOpenedProcess {
    std::shared_ptr<TLProcess> process; // null when there is none, or it may not be read
    platform::kern_return_t refusal = platform::KERN_SUCCESS;
};

/// The processes of `pids`, opened on all processors. @return one for each, in the order of `pids`.
std::vector<TLOpenedProcess> openProcesses(std::span<const std::int32_t> pids);

/// What could not be read among the processes of a table.
struct TLUnreadableProcesses {
    std::size_t count = 0;
    std::uint64_t residentAnonymous = 0; // bytes, as far as known
};

/// Every process that is not excluded and can be read; absent when the list cannot be obtained. The others
/// are left out in silence and only summed in `unreadable`.
std::optional<TLProcessTable> allProcessesExcludingPids(const TLPidSet& pids,
                                                        TLUnreadableProcesses* unreadable = nullptr);

/// The pids that the descriptions match by name (every process of that name) or number. Absent when the list
/// cannot be obtained. `errors`, when wanted, gets a message per description that matched nothing.
std::optional<TLTargetPids> pidsForStringDescriptions(std::span<const std::string> descriptions,
                                                      std::vector<std::string>* errors);

/// `pids` and all their descendants, level by level, each once; absent when the list cannot be obtained.
std::optional<std::vector<std::int32_t>> childPidsForPids(std::span<const std::int32_t> pids);

/// A copy of `table` without the processes that are tracked for idle exit and clean.
TLProcessTable removeIdleExitCleanProcessesFrom(const TLProcessTable& table);

} // namespace tally
