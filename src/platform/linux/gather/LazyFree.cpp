#include "platform/linux/gather/LazyFree.h"

#include "platform/linux/gather/MachineState.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/processes/ProcessStat.h"
#include "platform/linux/walk/DecodeMaps.h"
#include "platform/linux/walk/Task.h"

#include <algorithm>
#include <map>
#include <mutex>
#include <set>
#include <vector>

namespace tally::platform {

namespace {

struct Search {
    std::mutex mutex;
    bool isGathering = false;
    bool isPrepared = false;
    struct Candidate {
        std::int32_t pid = 0;
        std::uint64_t residentAnonymous = 0;
        bool hasRelatives = false; // whose lazily freed pages smaps can show in each of them
    };
    std::vector<Candidate> candidates; // rising by anonymous memory: the next one is the last
    std::uint64_t left = 0;            // bytes that were not found yet
    std::map<std::int32_t, bool> answers;
};

Search& search() {
    static Search current;
    return current;
}

std::uint64_t lazilyFreed(const std::string& folder) {
    return decodeRollupLazyFree(readSystemFile(folder + "/smaps_rollup").value_or(""));
}

void prepare(Search& search) {
    search.isPrepared = true;
    search.left = machineState().lazyFree;
    std::set<std::int32_t> pids; // a process can have several rights
    for (const auto& task : allTasks()) {
        if (!pids.insert(task->pid()).second) {
            continue;
        }
        if (const std::optional<ProcessStatus> status = readProcessStatus(task->pid())) {
            search.candidates.push_back({task->pid(), status->residentAnonymous, task->hasRelatives()});
        }
    }
    std::sort(search.candidates.begin(), search.candidates.end(),
              [](const auto& a, const auto& b) { return a.residentAnonymous < b.residentAnonymous; });
}

} // namespace

bool hasLazilyFreedMemory(std::int32_t pid, const std::string& folder, std::uint64_t residentAnonymous) {
    if (residentAnonymous == 0 || machineState().lazyFree == 0) {
        return false;
    }
    Search& current = search();
    const std::scoped_lock lock(current.mutex);
    if (!current.isGathering) {
        return lazilyFreed(folder) != 0;
    }
    if (!current.isPrepared) {
        prepare(current);
    }
    while (!current.answers.contains(pid) && !current.candidates.empty() && current.left != 0) {
        const Search::Candidate next = current.candidates.back();
        current.candidates.pop_back();
        const std::uint64_t found = lazilyFreed(processFolder(next.pid));
        current.answers[next.pid] = found != 0;
        if (!next.hasRelatives) {
            current.left -= std::min(found, current.left);
        }
    }
    const auto answer = current.answers.find(pid);
    return answer != current.answers.end() && answer->second;
}

void restartLazyFreeSearch(bool isGathering) {
    Search& current = search();
    const std::scoped_lock lock(current.mutex);
    current.isGathering = isGathering;
    current.isPrepared = false;
    current.candidates.clear();
    current.answers.clear();
}

} // namespace tally::platform
