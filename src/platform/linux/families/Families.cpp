#include "platform/linux/families/Families.h"

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

struct FamilyTable {
    std::mutex mutex;
    std::map<FamilyKey, Relatives> relatives;
    bool isGathering = false;
    bool isPrepared = false;
    // The random bytes of an exec tell programs apart whose layout is fixed; zeros for all others.
    std::map<std::pair<FamilyKey, std::array<std::uint64_t, 2>>, Family> families;
    std::map<std::int32_t, Family*> familyOfPid;
};

FamilyTable& familyTable() {
    static FamilyTable table;
    return table;
}

bool isBefore(const MemberIdentity& a, const MemberIdentity& b) { return a.pid < b.pid; }

/// Finds the families of two address spaces and more among all tasks.
void prepare(FamilyTable& table) {
    table.isPrepared = true;
    for (const auto& [key, relatives] : table.relatives) {
        if (relatives.size() < 2) {
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
            const Relatives& relatives = table.relatives[key.first];
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
    if (!key.isKnown()) {
        return std::make_shared<MemberIdentity>(task);
    }
    FamilyTable& table = familyTable();
    const std::scoped_lock lock(table.mutex);
    Relatives& relatives = table.relatives[key];
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
    const std::scoped_lock lock(familyTable().mutex);
    return *owner;
}

void leaveAddressSpace(const FamilyKey& key, MemberIdentity task) {
    FamilyTable& table = familyTable();
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

std::size_t countRelatives(const FamilyKey& key) {
    FamilyTable& table = familyTable();
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
    FamilyTable& table = familyTable();
    std::unique_lock lock(table.mutex);
    if (!table.isGathering || !key.isKnown()) {
        return std::nullopt;
    }
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

void beginFamilies() {
    FamilyTable& table = familyTable();
    const std::scoped_lock lock(table.mutex);
    table.isGathering = true;
}

void endFamilies() {
    FamilyTable& table = familyTable();
    const std::scoped_lock lock(table.mutex);
    table.isGathering = false;
    table.isPrepared = false;
    table.families.clear();
    table.familyOfPid.clear();
}

} // namespace tally::platform
