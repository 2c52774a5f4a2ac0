#include "process/TargetSelection.h"

#include "platform/dispatch.h"

#include <algorithm>
#include <cstdlib>
#include <functional>
#include <unordered_map>
#include <unordered_set>
#include <utility>

namespace tally {

using namespace platform;

namespace {

/// Calls item(0) to item(count - 1) on all processors.
void forEachOnAllProcessors(std::size_t count, const std::function<void(std::size_t)>& item) {
    dispatch_apply(count, {.label = "org.tally.opening"}, item);
}

std::int32_t pidOf(const proc_bsdinfo& info) { return static_cast<std::int32_t>(info.pbi_pid); }

/// The decimal integer at the start of `text`, whatever follows.
std::optional<std::int64_t> leadingInteger(const std::string& text) {
    char* end = nullptr;
    const std::int64_t value = std::strtoll(text.c_str(), &end, 10);
    return end == text.c_str() ? std::nullopt : std::optional(value);
}

/// Names of the processes of one list, each found out at most once.
class ProcessNames {
  public:
    explicit ProcessNames(std::span<const proc_bsdinfo> infos) : infos_(infos), names_(infos.size()) {}

    const std::string& operator[](std::size_t index) {
        if (!names_[index]) {
            names_[index] = TLProcess::nameForBsdInfo(infos_[index]);
        }
        return *names_[index];
    }

  private:
    std::span<const proc_bsdinfo> infos_;
    std::vector<std::optional<std::string>> names_;
};

/// Enters what `description` matches: every process of that name or, where none is called so, the one of that
/// number. @return whether it matches anything.
bool addMatches(TLTargetPids& matches, const std::string& description, std::span<const proc_bsdinfo> infos,
                ProcessNames& names) {
    bool isFound = false;
    for (std::size_t i = 0; i < infos.size(); ++i) {
        if (names[i] == description) {
            matches[pidOf(infos[i])] = description;
            isFound = true;
        }
    }
    const std::optional<std::int64_t> number = leadingInteger(description);
    if (!isFound && std::ranges::any_of(infos, [&](const auto& info) { return pidOf(info) == number; })) {
        matches[static_cast<std::int32_t>(*number)] = std::nullopt;
        isFound = true;
    }
    return isFound;
}

} // namespace

std::optional<std::vector<proc_bsdinfo>> copyAllBsdInfos() {
    constexpr std::size_t spare = 20; // processes that start between the two calls
    const int expected = proc_listallpids({});
    if (expected < 0) {
        return std::nullopt;
    }
    std::vector<std::int32_t> pids(static_cast<std::size_t>(expected) + spare);
    const int listed = proc_listallpids(pids);
    if (listed < 0) {
        return std::nullopt;
    }
    pids.resize(std::min(pids.size(), static_cast<std::size_t>(listed)));
    std::vector<std::optional<proc_bsdinfo>> found(pids.size());
    forEachOnAllProcessors(pids.size(), [&](std::size_t i) {
        proc_bsdinfo info;
        if (proc_pidinfo(pids[i], &info) == sizeof info) {
            found[i] = info;
        }
    });
    std::vector<proc_bsdinfo> infos;
    for (const auto& info : found) {
        if (info) {
            infos.push_back(*info);
        }
    }
    return infos.empty() ? std::nullopt : std::optional(std::move(infos));
}

std::vector<TLOpenedProcess> openProcesses(std::span<const std::int32_t> pids) {
    std::vector<TLOpenedProcess> opened(pids.size());
    forEachOnAllProcessors(pids.size(), [&](std::size_t i) {
        opened[i].process = TLProcess::processWithPid(pids[i], &opened[i].refusal);
    });
    return opened;
}

std::optional<TLProcessTable> allProcessesExcludingPids(const TLPidSet& pids,
                                                        TLUnreadableProcesses* unreadable) {
    auto infos = copyAllBsdInfos();
    if (!infos) {
        return std::nullopt;
    }
    std::erase_if(*infos, [&](const proc_bsdinfo& info) { return pids.contains(pidOf(info)); });
    std::vector<TLOpenedProcess> opened(infos->size());
    forEachOnAllProcessors(infos->size(), [&](std::size_t i) {
        opened[i].process = TLProcess::processWithBsdInfo((*infos)[i], &opened[i].refusal);
    });
    TLProcessTable table;
    for (std::size_t i = 0; i < opened.size(); ++i) {
        const proc_bsdinfo& info = (*infos)[i];
        if (opened[i].process) {
            table[info.pbi_pid] = std::move(opened[i].process);
        } else if (opened[i].refusal == KERN_NO_ACCESS && unreadable != nullptr) {
            rusage_info_v5 usage;
            if (proc_pid_rusage(pidOf(info), &usage) == 0) {
                unreadable->residentAnonymous += usage.ri_resident_anonymous;
            }
            ++unreadable->count;
        }
    }
    return table;
}

std::optional<TLTargetPids> pidsForStringDescriptions(std::span<const std::string> descriptions,
                                                      std::vector<std::string>* errors) {
    const auto infos = copyAllBsdInfos();
    if (!infos) {
        if (errors != nullptr) {
            *errors = {"Unable to obtain system process list"};
        }
        return std::nullopt;
    }
    TLTargetPids matches;
    ProcessNames names(*infos);
    for (const std::string& description : descriptions) {
        if (!addMatches(matches, description, *infos, names) && errors != nullptr) {
            errors->push_back("Unable to find pid for process matching '" + description + "'");
        }
    }
    return matches;
}

std::optional<std::vector<std::int32_t>> childPidsForPids(std::span<const std::int32_t> pids) {
    const auto infos = copyAllBsdInfos();
    if (!infos) {
        return std::nullopt;
    }
    std::unordered_map<std::int32_t, std::vector<std::size_t>> childrenOf; // indices, by parent
    for (std::size_t i = 0; i < infos->size(); ++i) {
        childrenOf[static_cast<std::int32_t>((*infos)[i].pbi_ppid)].push_back(i);
    }
    std::vector<std::int32_t> family;
    std::unordered_set<std::int32_t> known; // a process can be its own ancestor
    std::vector<std::int32_t> level(pids.begin(), pids.end());
    while (!level.empty()) {
        std::vector<std::size_t> next;
        for (const std::int32_t pid : level) {
            if (known.insert(pid).second) {
                family.push_back(pid);
                const auto& children = childrenOf[pid];
                next.insert(next.end(), children.begin(), children.end());
            }
        }
        std::ranges::sort(next); // the kernel's order, whoever the parent is
        level.clear();
        for (const std::size_t index : next) {
            level.push_back(pidOf((*infos)[index]));
        }
    }
    return family;
}

TLProcessTable removeIdleExitCleanProcessesFrom(const TLProcessTable& table) {
    TLProcessTable kept = table;
    std::erase_if(
        kept, [](const auto& entry) { return entry.second->idleExitStatus() == TLIdleExitStatus::clean; });
    return kept;
}

} // namespace tally
