// Process grouping: which exact sets of processes share memory, and how one member sees what a set shares.
//
// Every distinct set of processes that map one object becomes one group, which owns the objects mapped by
// exactly that set. One thread; regions must have their memory objects.

#pragma once

#include "analysis/TLMemoryCategory.h"
#include "analysis/TLProcessGroup.h"
#include "process/TLProcess.h"

#include <cstdint>
#include <memory>
#include <span>
#include <unordered_map>
#include <vector>

namespace tally {

struct ProcessGroups {
    using GroupList = std::vector<std::shared_ptr<TLProcessGroup>>;

    /// By pid: the group of this process alone first, when there is one; then by the first object met.
    std::unordered_map<std::int32_t, GroupList> groupsByPid;

    /// The groups of `process`, none for a process without regions.
    const GroupList& groupsOf(const TLProcess& process) const;
};

/// Groups the processes. A hidden process is a member only as the mapper of memory that a displayed process
/// owns and does not map.
ProcessGroups groupProcesses(std::span<const std::shared_ptr<TLProcess>> processes);

struct GroupCategories {
    std::shared_ptr<const TLCategoryDictionary> categories; // never null
    bool hasProcessView = false;                            // whether some object looks different to others
};

/// The memory of `group` as its member `process` sees it. Where all members of a large group see the same, it
/// is summed once and kept for the others.
GroupCategories categoriesForGroup(TLProcessGroup& group, const TLProcess& process, bool summarize);

} // namespace tally
