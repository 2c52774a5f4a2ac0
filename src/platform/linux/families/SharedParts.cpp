#include "platform/linux/families/SharedParts.h"

#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/pages/Mapping.h"

#include <algorithm>
#include <unordered_map>
#include <unordered_set>

namespace tally::platform {

namespace {

constexpr std::size_t mostKeptSets = 16;
const std::uint64_t worthKeeping = (64 << 10) / basePage; // pages
constexpr std::size_t mostSetsOfImage = 64;

/// The clusters of which every set is kept: images whose copies make no more sets than a reader can make use
/// of.
std::vector<bool> clustersKeptWhole(const FamilySharing& family) {
    std::vector<std::unordered_set<std::size_t>> sets(family.keepsAllSets.size());
    for (const SetPages& count : family.counts) {
        const std::size_t cluster = family.slots[count.slot].cluster;
        if (family.keepsAllSets[cluster] != 0 && sets[cluster].size() <= mostSetsOfImage) {
            sets[cluster].insert(count.set);
        }
    }
    std::vector<bool> kept(sets.size());
    for (std::size_t cluster = 0; cluster < sets.size(); ++cluster) {
        kept[cluster] = family.keepsAllSets[cluster] != 0 && sets[cluster].size() <= mostSetsOfImage;
    }
    return kept;
}

/// The sets with the most memory, as far as they are worth a section of the report each.
std::vector<bool> keptSets(const FamilySharing& family, const std::vector<bool>& keptWhole) {
    std::vector<std::uint64_t> pages(family.sets.size());
    for (const SetPages& count : family.counts) {
        if (!keptWhole[family.slots[count.slot].cluster]) {
            pages[count.set] += count.resident + count.swapped;
        }
    }
    std::vector<std::size_t> order(pages.size());
    for (std::size_t i = 0; i < order.size(); ++i) {
        order[i] = i;
    }
    const std::size_t most = std::min(mostKeptSets, order.size());
    std::partial_sort(
        order.begin(), order.begin() + static_cast<std::ptrdiff_t>(most), order.end(),
        [&](std::size_t a, std::size_t b) { return pages[a] != pages[b] ? pages[a] > pages[b] : a < b; });
    std::vector<bool> kept(pages.size());
    for (std::size_t i = 0; i < most; ++i) {
        kept[order[i]] = pages[order[i]] >= worthKeeping;
    }
    return kept;
}

/// Appends what members hold to their parts, with one entry per object and mapping.
class PartCollector {
  public:
    explicit PartCollector(std::span<const std::vector<MemberMapping>> mappings)
        : mappings_(mappings), cursors_(mappings.size()), objects_(mappings.size()), parts_(mappings.size()) {
    }

    void add(std::size_t member, std::uint64_t address, std::uint64_t objectId, std::uint64_t pagesBelow,
             std::uint64_t resident, std::uint64_t swapped) {
        const std::vector<MemberMapping>& mappings = mappings_[member];
        std::size_t& cursor = cursors_[member];
        while (mappings[cursor].range.end <= address) {
            ++cursor;
            objects_[member].clear();
        }
        const auto [entry, isNew] = objects_[member].try_emplace(objectId, parts_[member].size());
        if (isNew) {
            parts_[member].push_back({mappings[cursor].index, objectId, pagesBelow, 0, 0});
        }
        SharedPart& part = parts_[member][entry->second];
        part.resident += resident;
        part.swapped += swapped;
    }

    std::vector<std::vector<SharedPart>> take() { return std::move(parts_); }

  private:
    std::span<const std::vector<MemberMapping>> mappings_;
    std::vector<std::size_t> cursors_; // the mapping that each member is at
    std::vector<std::unordered_map<std::uint64_t, std::size_t>> objects_; // and the part of each object there
    std::vector<std::vector<SharedPart>> parts_;
};

std::uint64_t identityOfSet(const FamilySharing& family, const std::vector<std::uint32_t>& set) {
    std::uint64_t identity = family.familyKey;
    for (const std::uint32_t member : set) {
        identity = combinedIdentity(identity, static_cast<std::uint64_t>(family.members[member].pid),
                                    family.members[member].startTicks);
    }
    return identity;
}

} // namespace

std::vector<MemberMapping> privateMappings(std::span<const Mapping> mappings) {
    std::vector<MemberMapping> found;
    for (std::size_t i = 0; i < mappings.size(); ++i) {
        if (mappings[i].isPrivate()) {
            found.push_back({{mappings[i].start, mappings[i].end}, i, mappings[i].isFileBacked()});
        }
    }
    return found;
}

std::vector<char> imageClusters(std::span<const AddressSlot> slots,
                                std::span<const std::vector<MemberMapping>> mappings) {
    std::vector<char> isImage(slots.empty() ? 0 : slots.back().cluster + 1);
    for (const std::vector<MemberMapping>& member : mappings) {
        std::size_t slot = 0;
        std::uint64_t imageEnd = 0;
        for (const MemberMapping& mapping : member) {
            while (slots[slot].start < mapping.range.start) {
                ++slot;
            }
            if (mapping.isFile || mapping.range.start == imageEnd) {
                isImage[slots[slot].cluster] = 1;
                imageEnd = mapping.isFile ? mapping.range.end : 0;
            }
        }
    }
    return isImage;
}

std::vector<std::vector<SharedPart>> sharedParts(const FamilySharing& family,
                                                 std::span<const std::vector<MemberMapping>> mappings) {
    const std::vector<bool> keptWhole = clustersKeptWhole(family);
    const std::vector<bool> kept = keptSets(family, keptWhole);
    std::vector<std::uint64_t> setIdentities;
    setIdentities.reserve(family.sets.size());
    for (const std::vector<std::uint32_t>& set : family.sets) {
        setIdentities.push_back(identityOfSet(family, set));
    }
    PartCollector collector(mappings);
    std::unordered_map<std::uint64_t, std::uint64_t> pagesOfObject; // so far

    std::vector<std::pair<std::uint64_t, std::uint64_t>> added; // to be counted once the slot is done
    for (std::size_t i = 0; i < family.counts.size(); ++i) {
        const SetPages& count = family.counts[i];
        const AddressSlot& slot = family.slots[count.slot];
        const std::vector<std::uint32_t>& set = family.sets[count.set];
        const auto enter = [&](std::uint64_t objectId, std::uint64_t resident, std::uint64_t swapped) {
            if (resident + swapped == 0) {
                return;
            }
            const std::uint64_t below = pagesOfObject[objectId];
            for (const std::uint32_t member : set) {
                collector.add(member, slot.start, objectId, below, resident, swapped);
            }
            added.emplace_back(objectId, resident + swapped);
        };
        if (kept[count.set] || keptWhole[slot.cluster]) {
            enter(objectIdOfSharedSet(setIdentities[count.set], slot.clusterStart), count.resident,
                  count.swapped);
        } else {
            // Members hold different parts of a folded object, so what is resident and what is swapped stay
            // apart.
            const std::uint64_t holder = identityOfSet(family, {set.front()});
            enter(objectIdOfFoldedSets(holder, slot.clusterStart, true), count.resident, 0);
            enter(objectIdOfFoldedSets(holder, slot.clusterStart, false), 0, count.swapped);
        }
        if (i + 1 == family.counts.size() || family.counts[i + 1].slot != count.slot) {
            for (const auto& [objectId, pages] : added) {
                pagesOfObject[objectId] += pages;
            }
            added.clear();
        }
    }
    return collector.take();
}

} // namespace tally::platform
