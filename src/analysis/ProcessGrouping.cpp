// Process grouping: every object collects the processes that map it; objects with equal sets of them then
// find one group through a hash table of sets.
//
// Cost: a table look-up per region, and a comparison of members per object.

#include "analysis/ProcessGrouping.h"

#include "base/BatchEnumeration.h"

#include <cstddef>
#include <unordered_set>
#include <utility>

namespace tally {

namespace {

using PidSet = std::unordered_set<std::int32_t>;

struct ObjectMembers {
    TLMemoryObject* object = nullptr; // owned by the tables
    TLProcessGroupMinimal members;
};

bool isUnmappedMemoryOfDisplayed(const TLMemoryObject& object, const PidSet& displayedPids) {
    return object.ownerPid != -1 && displayedPids.contains(object.ownerPid) &&
           object.hasUnmappedOwnedRegion();
}

/// Every object that counts with the processes that map it, in the order in which objects are first met.
std::vector<ObjectMembers> membersByObject(std::span<const std::shared_ptr<TLProcess>> processes,
                                           const PidSet& displayedPids) {
    std::vector<ObjectMembers> objects;
    std::unordered_map<const TLMemoryObject*, std::size_t> indexByObject;
    for (const auto& process : processes) {
        const auto addBatch = [&](std::span<const TLMemoryRegion> batch) {
            for (const TLMemoryRegion& region : batch) {
                TLMemoryObject* const object = region.memoryObject;
                if (process->hiddenFromDisplay() && !isUnmappedMemoryOfDisplayed(*object, displayedPids)) {
                    continue;
                }
                const auto [known, isNew] = indexByObject.try_emplace(object, objects.size());
                if (isNew) {
                    objects.push_back({object, {}});
                }
                objects[known->second].members.addProcess(process);
            }
        };
        tl_enumerateObjectsWithBatchSize(std::span(std::as_const(*process).memoryRegions()), 256, addBatch);
    }
    return objects;
}

struct GroupHash {
    std::size_t operator()(const TLProcessGroupMinimal* group) const { return group->hash(); }
};

struct GroupEqual {
    bool operator()(const TLProcessGroupMinimal* a, const TLProcessGroupMinimal* b) const {
        return a->isEqual(*b);
    }
};

/// One group per distinct set of members, each with its objects.
ProcessGroups::GroupList makeGroups(std::vector<ObjectMembers> objects, std::size_t displayedCount) {
    ProcessGroups::GroupList groups;
    std::unordered_map<const TLProcessGroupMinimal*, TLProcessGroup*, GroupHash, GroupEqual> known;
    known.reserve(6 * displayedCount);
    for (ObjectMembers& entry : objects) {
        const auto twin = known.find(&entry.members);
        TLProcessGroup* group = twin == known.end() ? nullptr : twin->second;
        if (group == nullptr) {
            groups.push_back(TLProcessGroup::makeImmutableGroup(std::move(entry.members)));
            group = groups.back().get();
            known.emplace(group, group);
        }
        group->addObject(entry.object->shared_from_this());
    }
    return groups;
}

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
    ProcessGroups result;
    for (const auto& group : makeGroups(membersByObject(processes, displayedPids), displayedPids.size())) {
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
        category->second.addMemoryObject(std::move(view));
    }
    constexpr std::size_t smallestCachedGroup = 26;
    const std::size_t memberCount = group.processes().size();
    if (looksTheSameToAll && memberCount >= smallestCachedGroup) {
        group.cacheCategories(categories, static_cast<std::uint32_t>(memberCount - 1));
    }
    return {categories, hasProcessView};
}

} // namespace tally
