#include "platform/linux/families/Families.h"

#include "platform/linux/io/Gather.h"
#include "platform/linux/objects/ObjectId.h"

#include <algorithm>
#include <map>
#include <memory>
#include <mutex>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

/// One address space and the tasks that have it, rising by pid.
struct Tenants {
    std::vector<MemberIdentity> tasks;
    std::shared_ptr<MemberIdentity> owner;
};

/// The address spaces of processes with one key, in the order in which the kernel compares them.
using Relatives = std::vector<Tenants>;

/// One family in one gather.
struct Family {
    std::uint64_t key = 0;
    std::vector<MemberIdentity> members; // one per address space, rising by pid
    std::vector<std::size_t> readers;    // tasks of each that have not taken it yet
    std::unique_ptr<FamilyScan> scan;    // once a member is walked
    std::vector<AddressSpace> spaces;    // once the scan is done
};

/// The address spaces to which there are rights.
struct SpaceTable {
    std::mutex mutex;
    std::map<FamilyKey, Relatives> relatives;
};

SpaceTable& spaceTable() {
    static SpaceTable table;
    return table;
}

/// The families of one gather.
struct FamilyTable {
    std::mutex mutex;
    bool isPrepared = false;
    // The random bytes of an exec tell programs apart whose layout is fixed; zeros for all others.
    std::map<std::pair<FamilyKey, std::array<std::uint64_t, 2>>, Family> families;
    std::map<std::int32_t, Family*> familyOfPid;
};

bool isBefore(const MemberIdentity& a, const MemberIdentity& b) { return a.pid < b.pid; }

/// Finds the families of two address spaces and more among all tasks.
void prepare(FamilyTable& table) {
    table.isPrepared = true;
    SpaceTable& spaces = spaceTable();
    const std::scoped_lock lock(spaces.mutex);
    for (const auto& [key, relatives] : spaces.relatives) {
        if (relatives.size() < 2 || !key.isKnown()) {
            continue;
        }
        for (const Tenants& tenants : relatives) {
            const MemberIdentity& owner = tenants.tasks.front();
            const auto random =
                isLayoutFixed(owner.pid) ? readExecRandom(owner.pid) : decltype(readExecRandom(0)){};
            Family& family = table.families[{key, random}];
            family.key = combinedIdentity(key.layout[0], key.layout[2], key.layout[5] ^ random[0]);
            family.members.push_back(owner);
        }
    }
    std::erase_if(table.families, [](const auto& entry) { return entry.second.members.size() < 2; });
    for (auto& [key, family] : table.families) {
        std::sort(family.members.begin(), family.members.end(), isBefore);
        for (const MemberIdentity& member : family.members) {
            const Relatives& relatives = spaces.relatives[key.first];
            const auto tenants = std::find_if(relatives.begin(), relatives.end(), [&](const Tenants& each) {
                return each.tasks.front().pid == member.pid;
            });
            family.readers.push_back(tenants->tasks.size());
            table.familyOfPid[member.pid] = &family;
        }
    }
}

} // namespace

AddressSpaceOwner enterAddressSpace(const FamilyKey& key, MemberIdentity task) {
    SpaceTable& table = spaceTable();
    const std::scoped_lock lock(table.mutex);
    Relatives& relatives = table.relatives[key];
    if (!key.isKnown()) {
        return relatives.emplace_back(Tenants{{task}, std::make_shared<MemberIdentity>(task)}).owner;
    }
    std::size_t low = 0;
    std::size_t high = relatives.size();
    while (low < high) {
        const std::size_t middle = (low + high) / 2;
        const int order = compareAddressSpaces(relatives[middle].tasks.front().pid, task.pid);
        if (order == 0) {
            auto& [tasks, owner] = relatives[middle];
            tasks.insert(std::upper_bound(tasks.begin(), tasks.end(), task, isBefore), task);
            *owner = isBefore(task, *owner) ? task : *owner;
            return owner;
        }
        if (order == incomparableAddressSpaces) {
            break; // one of the two has ended, or may not be compared
        }
        (order < 0 ? low : high) = order < 0 ? middle + 1 : middle;
    }
    auto owner = std::make_shared<MemberIdentity>(task);
    relatives.insert(relatives.begin() + static_cast<std::ptrdiff_t>(low), Tenants{{task}, owner});
    return owner;
}

MemberIdentity identityOf(const AddressSpaceOwner& owner) {
    const std::scoped_lock lock(spaceTable().mutex);
    return *owner;
}

void leaveAddressSpace(const FamilyKey& key, MemberIdentity task) {
    SpaceTable& table = spaceTable();
    const std::scoped_lock lock(table.mutex);
    const auto found = table.relatives.find(key);
    if (found == table.relatives.end()) {
        return;
    }
    bool removed = false; // only one of several rights to the same process
    for (Tenants& tenants : found->second) {
        const auto same =
            std::find_if(tenants.tasks.begin(), tenants.tasks.end(), [&](const MemberIdentity& each) {
                return each.pid == task.pid && each.startTicks == task.startTicks;
            });
        if (!removed && same != tenants.tasks.end()) {
            tenants.tasks.erase(same);
            removed = true;
        }
    }
    std::erase_if(found->second, [](const Tenants& tenants) { return tenants.tasks.empty(); });
    if (found->second.empty()) {
        table.relatives.erase(found);
    }
}

std::map<std::int32_t, FamilyKey> enteredProcesses() {
    SpaceTable& table = spaceTable();
    const std::scoped_lock lock(table.mutex);
    std::map<std::int32_t, FamilyKey> processes;
    for (const auto& [key, relatives] : table.relatives) {
        for (const Tenants& tenants : relatives) {
            for (const MemberIdentity& task : tenants.tasks) {
                processes.emplace(task.pid, key);
            }
        }
    }
    return processes;
}

std::size_t countRelatives(const FamilyKey& key) {
    SpaceTable& table = spaceTable();
    const std::scoped_lock lock(table.mutex);
    const auto found = table.relatives.find(key);
    std::size_t count = 0;
    if (found != table.relatives.end()) {
        for (const Tenants& tenants : found->second) {
            for (std::size_t i = 0; i < tenants.tasks.size(); ++i) { // rising by pid
                count += i == 0 || tenants.tasks[i].pid != tenants.tasks[i - 1].pid ? 1 : 0;
            }
        }
    }
    return count;
}

std::optional<AddressSpace> takeFamilySpace(const FamilyKey& key, MemberIdentity owner) {
    FamilyTable* const gathered = key.isKnown() ? Gather::table<FamilyTable>() : nullptr;
    if (gathered == nullptr) {
        return std::nullopt;
    }
    FamilyTable& table = *gathered;
    std::unique_lock lock(table.mutex);
    if (!table.isPrepared) {
        prepare(table);
    }
    const auto found = table.familyOfPid.find(owner.pid);
    if (found == table.familyOfPid.end()) {
        return std::nullopt;
    }
    Family& own = *found->second;
    if (!own.scan) {
        own.scan = std::make_unique<FamilyScan>(own.key, own.members);
    }
    lock.unlock();
    own.scan->join();
    lock.lock();
    if (own.spaces.empty()) {
        own.spaces = own.scan->takeSpaces();
    }
    const auto member = std::lower_bound(own.members.begin(), own.members.end(), owner, isBefore);
    const auto index = static_cast<std::size_t>(member - own.members.begin());
    AddressSpace& space = own.spaces[index];
    if (own.readers[index] == 0) {
        return std::nullopt;
    }
    return --own.readers[index] == 0 ? std::move(space) : space;
}

} // namespace tally::platform
