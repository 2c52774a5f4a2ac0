// Process grouping: every object finds the set of processes that map it.
//
// The idea: processes are added in one order. So two things tell a set: the set it grew from, and the process
// that joined last. Sets that agree in both are one, and members are never compared. Cost: a step per region,
// and a look-up per set and process. One thread.

#include "analysis/ProcessGrouping.h"

#include "base/BatchEnumeration.h"

#include <algorithm>
#include <cstddef>
#include <unordered_map>
#include <unordered_set>
#include <utility>

namespace tally {

namespace {

using PidSet = std::unordered_set<std::int32_t>;

/// A set of processes: the one it grew from, and who joined it last.
struct GrownSet {
    std::size_t from = 0;
    const std::shared_ptr<TLProcess>* joined = nullptr; // null for the empty set
    std::shared_ptr<TLProcessGroup> group; // made when an object turns out to have exactly this set
};

struct GroupedObject {
    TLMemoryObject* object = nullptr; // owned by the tables
    std::size_t set = 0;
};

bool isUnmappedMemoryOfDisplayed(const TLMemoryObject& object, const PidSet& displayedPids) {
    return object.ownerPid != -1 && displayedPids.contains(object.ownerPid) &&
           object.hasUnmappedOwnedRegion();
}

/// All sets of processes, and the objects in the order in which they are first met.
struct Grouping {
    std::vector<GrownSet> sets{GrownSet()}; // the empty one first
    std::vector<GroupedObject> objects;
    std::shared_ptr<TLProcess> lastAdded;
    std::unordered_map<std::size_t, std::size_t> grown; // set without the process added last to set with it

    /// Adds `process` to the sets of the objects it maps. `displayedPids`: whose memory counts.
    void add(const std::shared_ptr<TLProcess>& process, const PidSet& displayedPids) {
        if (!lastAdded || lastAdded->pid() != process->pid()) {
            grown.clear();
        }
        lastAdded = process;
        const auto addBatch = [&](std::span<const TLMemoryRegion> batch) {
            for (const TLMemoryRegion& region : batch) {
                TLMemoryObject* const object = region.memoryObject;
                if (process->hiddenFromDisplay() && !isUnmappedMemoryOfDisplayed(*object, displayedPids)) {
                    continue;
                }
                if (object->reportIndex == TLMemoryObject::notInReport) {
                    object->reportIndex = objects.size();
                    objects.push_back({object, 0});
                }
                std::size_t& set = objects[object->reportIndex].set;
                if (sets[set].joined == nullptr || (*sets[set].joined)->pid() != process->pid()) {
                    const auto [known, isNew] = grown.try_emplace(set, sets.size());
                    if (isNew) {
                        sets.push_back({set, &process, nullptr});
                    }
                    set = known->second;
                }
            }
        };
        tl_enumerateObjectsWithBatchSize(std::span(std::as_const(*process).memoryRegions()), 256, addBatch);
    }

    TLProcessGroupMinimal members(std::size_t set) const {
        std::vector<const std::shared_ptr<TLProcess>*> latestFirst;
        for (; sets[set].joined != nullptr; set = sets[set].from) {
            latestFirst.push_back(sets[set].joined);
        }
        TLProcessGroupMinimal minimal;
        for (auto process = latestFirst.rbegin(); process != latestFirst.rend(); ++process) {
            minimal.addProcess(**process);
        }
        return minimal;
    }

    /// One group per set that is exactly an object's, each with its objects.
    ProcessGroups::GroupList makeGroups() {
        ProcessGroups::GroupList groups;
        for (const GroupedObject& entry : objects) {
            std::shared_ptr<TLProcessGroup>& group = sets[entry.set].group;
            if (!group) {
                group = groups.emplace_back(TLProcessGroup::makeImmutableGroup(members(entry.set)));
            }
            group->addObject(entry.object->shared_from_this());
        }
        return groups;
    }
};

} // namespace

const ProcessGroups::GroupList& ProcessGroups::groupsOf(const TLProcess& process) const {
    static const GroupList none;
    const auto found = groupsByPid.find(process.pid());
    return found == groupsByPid.end() ? none : found->second;
}

ProcessGroups groupProcesses(std::span<const std::shared_ptr<TLProcess>> processes) {
    PidSet displayedPids;
    for (const auto& process : processes) {
        if (!process->hiddenFromDisplay()) {
            displayedPids.insert(process->pid());
        }
    }
    // Members are told by their pid alone: those of one pid, a process and a snapshot of it, come one after
    // the other.
    std::vector<std::shared_ptr<TLProcess>> byPid(processes.begin(), processes.end());
    std::ranges::stable_sort(byPid, {}, [](const auto& process) { return process->pid(); });
    Grouping grouping;
    for (const auto& process : byPid) {
        grouping.add(process, displayedPids);
    }
    ProcessGroups result;
    for (const auto& group : grouping.makeGroups()) {
        const bool isPrivate = group->processes().size() == 1;
        for (const auto& process : group->processes()) {
            auto& groups = result.groupsByPid[process->pid()];
            groups.insert(isPrivate ? groups.begin() : groups.end(), group);
        }
    }
    return result;
}

GroupCategories categoriesForGroup(TLProcessGroup& group, const TLProcess& process, bool summarize) {
    if (auto cached = group.takeCachedCategories()) {
        return {std::move(cached), false};
    }
    const auto categories = std::make_shared<TLCategoryDictionary>();
    bool hasProcessView = false;
    bool looksTheSameToAll = true;
    for (const auto& object : group.objects()) {
        std::shared_ptr<const TLMemoryObject> view = object->viewForProcess(process);
        hasProcessView = hasProcessView || view != object;
        looksTheSameToAll = looksTheSameToAll && !object->hasProcessSpecificSizes();
        const auto category =
            categories->try_emplace(categoryKey(*object, summarize), TLMemoryCategory(summarize)).first;
        category->second.addViewOfObject(std::move(view), object);
    }
    constexpr std::size_t smallestCachedGroup = 26;
    const std::size_t memberCount = group.processes().size();
    if (looksTheSameToAll && memberCount >= smallestCachedGroup) {
        group.cacheCategories(categories, static_cast<std::uint32_t>(memberCount - 1));
    }
    return {categories, hasProcessView};
}

} // namespace tally
