#include "platform/linux/corpse/CorpseFamilies.h"

#include "platform/linux/families/AddressSlots.h"
#include "platform/linux/io/MachineNotices.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/objects/ObjectId.h"

#include <algorithm>
#include <mutex>
#include <optional>
#include <utility>

namespace tally::platform {

namespace {

using Spaces = std::vector<std::shared_ptr<CorpseSpace>>;

struct CorpseTable {
    std::mutex mutex;
    std::vector<std::weak_ptr<CorpseSpace>> spaces; // in the order in which they were made

    /// Those that are still there and that a gather has not met yet.
    Spaces current() {
        Spaces found;
        std::erase_if(spaces, [&](const auto& weak) {
            std::shared_ptr<CorpseSpace> space = weak.lock();
            const bool isPast = !space || space->isSettled;
            if (!isPast) {
                found.push_back(std::move(space));
            }
            return isPast;
        });
        return found;
    }
};

CorpseTable& corpseTable() {
    static CorpseTable table;
    return table;
}

constexpr std::uint64_t windowPages = 1024;

/// Counts the pages that members hold together. Members rise by pid; `order[m]` is the turn in which member m
/// was looked at.
class SharingCount {
  public:
    SharingCount(const Spaces& members, std::span<const std::size_t> order)
        : members_(members), order_(order), pages_(members.size()), keys_(members.size()),
          sets(members.size()) {
        for (std::size_t i = 0; i < members.size(); ++i) {
            indices_.push_back(static_cast<std::uint32_t>(i));
        }
    }

    void countSlot(std::size_t slot, const AddressSlot& range) {
        for (std::uint64_t address = nextHeld(range.start); address < range.end;
             address = nextHeld(address)) {
            const std::uint64_t end = std::min(range.end, address + windowPages * basePage);
            for (; address < end; address += basePage) {
                countPage(slot, address);
            }
        }
    }

  private:
    std::uint64_t nextHeld(std::uint64_t address) const {
        std::uint64_t next = ~std::uint64_t{0};
        for (const auto& member : members_) {
            next = std::min(next, member->held.nextHeld(address));
        }
        return next;
    }

    void countPage(std::size_t slot, std::uint64_t address) {
        for (std::size_t i = 0; i < members_.size(); ++i) {
            pages_[i] = members_[i]->held.at(address);
        }
        for (std::size_t i = 0; i < members_.size(); ++i) {
            keys_[i] = isProven(i) ? pages_[i].key : 0;
        }
        sets.addPages(slot, indices_, keys_, 1);
    }

    /// Whether the member's frame was still the same one when a relative was seen to have it: not when no
    /// other process mapped it, unless the relative was looked at before.
    bool isProven(std::size_t member) const {
        if (!pages_[member].exclusive) {
            return true;
        }
        for (std::size_t i = 0; i < members_.size(); ++i) {
            if (order_[i] < order_[member] && pages_[i].key == pages_[member].key && !pages_[i].exclusive) {
                return true;
            }
        }
        return false;
    }

    const Spaces& members_;
    std::span<const std::size_t> order_;
    std::vector<std::uint32_t> indices_;
    std::vector<HeldPage> pages_; // of one address, by member
    std::vector<PageKey> keys_;

  public:
    SharingSets sets;
};

void divideFamily(Spaces members) {
    std::vector<std::size_t> order(members.size());
    for (std::size_t i = 0; i < members.size(); ++i) {
        order[i] = i;
    }
    std::sort(order.begin(), order.end(),
              [&](std::size_t a, std::size_t b) { return members[a]->owner.pid < members[b]->owner.pid; });
    Spaces byPid;
    std::vector<MemberIdentity> identities;
    std::vector<std::vector<MemberMapping>> mappings;
    std::vector<AddressRange> ranges;
    for (const std::size_t turn : order) {
        byPid.push_back(members[turn]);
        identities.push_back(members[turn]->owner);
        mappings.push_back(privateMappings(members[turn]->walk->mappings()));
        for (const MemberMapping& mapping : mappings.back()) {
            ranges.push_back(mapping.range);
        }
    }
    const std::vector<AddressSlot> slots = addressSlots(ranges);
    SharingCount count(byPid, order);
    for (std::size_t slot = 0; slot < slots.size(); ++slot) {
        count.countSlot(slot, slots[slot]);
    }
    const std::vector<SetPages> counts = count.sets.takeCounts();
    const std::vector<char> isImage = imageClusters(slots, mappings);
    const FamilyKey& key = byPid.front()->key;
    const std::uint64_t familyKey =
        combinedIdentity(key.layout[0], key.layout[2], key.layout[5] ^ byPid.front()->execRandom[0]);
    const std::vector<std::vector<SharedPart>> parts =
        sharedParts({familyKey, identities, slots, count.sets.sets(), counts, isImage}, mappings);
    for (std::size_t i = 0; i < byPid.size(); ++i) {
        byPid[i]->walk->divide(parts[i]);
        if (byPid[i]->held.areFramesHidden()) {
            byPid[i]->notices.emplace_back(corpseSharingNotice);
        }
    }
}

} // namespace

void enterCorpse(const std::shared_ptr<CorpseSpace>& space) {
    CorpseTable& table = corpseTable();
    const std::scoped_lock lock(table.mutex);
    table.spaces.push_back(space);
}

std::shared_ptr<CorpseSpace> corpseSpaceOfTwin(const FamilyKey& key, MemberIdentity task) {
    CorpseTable& table = corpseTable();
    const std::scoped_lock lock(table.mutex);
    for (const auto& space : table.current()) {
        if (!key.isKnown() || space->key != key || space->owner.pid == task.pid) {
            continue;
        }
        const std::optional<ProcessStat> stat = readProcessStat(space->owner.pid);
        if (stat && stat->startTicks == space->owner.startTicks &&
            compareAddressSpaces(space->owner.pid, task.pid) == 0) {
            return space;
        }
    }
    return nullptr;
}

void settleCorpseFamily(CorpseSpace& space) {
    CorpseTable& table = corpseTable();
    const std::scoped_lock lock(table.mutex);
    if (space.isSettled) {
        return;
    }
    Spaces family = table.current();
    std::erase_if(family, [&](const auto& each) {
        return each->key != space.key || each->execRandom != space.execRandom;
    });
    if (family.size() > 1 && space.key.isKnown()) {
        divideFamily(family);
        for (const auto& each : family) {
            each->isSettled = true;
            each->held = HeldPages();
        }
    }
    space.isSettled = true;
    space.held = HeldPages();
}

std::vector<std::string> noticesOf(const CorpseSpace& space) {
    const std::scoped_lock lock(corpseTable().mutex);
    return space.notices;
}

std::size_t countCorpses(const FamilyKey& key) {
    CorpseTable& table = corpseTable();
    const std::scoped_lock lock(table.mutex);
    return static_cast<std::size_t>(
        std::ranges::count_if(table.current(), [&](const auto& space) { return space->key == key; }));
}

} // namespace tally::platform
