#include "platform/linux/walk/LazyFree.h"

#include "platform/linux/families/Families.h"
#include "platform/linux/io/Gather.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/MachineState.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/pages/DecodeMaps.h"

#include <algorithm>
#include <condition_variable>
#include <cstddef>
#include <iterator>
#include <map>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

struct Search {
    std::mutex mutex;
    std::condition_variable changed;
    bool isPrepared = false;
    struct Candidate {
        std::int32_t pid = 0;
        std::uint64_t residentAnonymous = 0;
        FamilyKey family;
    };
    std::vector<Candidate> candidates; // rising by anonymous memory: the next one is the last
    std::uint64_t left = 0;            // bytes that were not found yet
    std::map<std::int32_t, bool> answers;
    std::size_t asked = 0; // whose answer is under way
    // The most that a member of each family has: smaps can show the same lazily freed pages in all of them.
    std::map<FamilyKey, std::uint64_t> largestOfFamily;
};

/// Bytes of it; absent when the kernel does not tell, and smaps must be asked.
std::optional<std::uint64_t> lazilyFreed(const std::string& folder) {
    const std::optional<std::string> text = readSystemRecord(folder + "/smaps_rollup");
    return text ? std::optional(decodeRollupLazyFree(*text)) : std::nullopt;
}

void prepare(Search& search) {
    search.isPrepared = true;
    search.left = machineState().lazyFree;
    for (const auto& [pid, family] : enteredProcesses()) {
        search.candidates.push_back({pid, readResidentAnonymous(pid).value_or(0), family});
    }
    std::sort(search.candidates.begin(), search.candidates.end(),
              [](const auto& a, const auto& b) { return a.residentAnonymous < b.residentAnonymous; });
}

/// Takes what one process has off what is left to be found.
void enter(Search& search, const Search::Candidate& candidate, std::optional<std::uint64_t> answer) {
    const std::uint64_t found = answer.value_or(0);
    search.answers[candidate.pid] = answer != 0;
    std::uint64_t known = 0;
    if (candidate.family.isKnown() && found != 0) {
        std::uint64_t& largest = search.largestOfFamily[candidate.family];
        known = std::exchange(largest, std::max(largest, found));
    }
    search.left -= std::min(found - std::min(known, found), search.left);
}

/// Asks one candidate, without the lock meanwhile.
void ask(Search& search, std::vector<Search::Candidate>::iterator candidate,
         std::unique_lock<std::mutex>& lock) {
    const Search::Candidate asked = *candidate;
    search.candidates.erase(candidate);
    ++search.asked;
    lock.unlock();
    const std::optional<std::uint64_t> found = lazilyFreed(processFolder(asked.pid));
    lock.lock();
    --search.asked;
    enter(search, asked, found);
    search.changed.notify_all();
}

} // namespace

bool hasLazilyFreedMemory(std::int32_t pid, const std::string& folder) {
    if (machineState().lazyFree == 0) {
        return false;
    }
    Search* const search = Gather::table<Search>();
    if (search == nullptr) {
        return lazilyFreed(folder) != 0;
    }
    Search& current = *search;
    std::unique_lock lock(current.mutex);
    if (!current.isPrepared) {
        prepare(current);
    }
    while (!current.answers.contains(pid)) {
        if (current.left != 0 && !current.candidates.empty()) {
            ask(current, std::prev(current.candidates.end()), lock);
        } else if (current.asked != 0) {
            current.changed.wait(lock);
        } else {
            // All is found; but relatives of one that has some can show the same pages.
            const auto own = std::ranges::find(current.candidates, pid, &Search::Candidate::pid);
            if (own == current.candidates.end() || !current.largestOfFamily.contains(own->family)) {
                return false;
            }
            ask(current, own, lock);
        }
    }
    return current.answers[pid];
}

} // namespace tally::platform
