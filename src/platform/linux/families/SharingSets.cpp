#include "platform/linux/families/SharingSets.h"

#include <algorithm>
#include <bit>

namespace tally::platform {

namespace {

/// A number for each member that looks random, the same in every object (the finaliser of splitmix64). Two
/// different sets of some 15,000 get one signature with a chance of 1 in 10^11.
std::uint64_t signatureOf(std::size_t member) {
    std::uint64_t value = (member + 1) * 0x9e37'79b9'7f4a'7c15;
    value = (value ^ value >> 30) * 0xbf58'476d'1ce4'e5b9;
    value = (value ^ value >> 27) * 0x94d0'49bb'1331'11eb;
    return value ^ value >> 31;
}

} // namespace

SharingSets::SharingSets(std::size_t members) {
    for (std::size_t i = 0; i < members; ++i) {
        memberSignatures_.push_back(signatureOf(i));
    }
    table_.resize(std::bit_ceil(members * 2 + 1));
}

void SharingSets::addPages(std::size_t slot, std::span<const std::uint32_t> members,
                           std::span<const PageKey> keys, std::uint64_t pages) {
    begin(slot);
    ++page_;
    used_.clear();
    const std::size_t mask = table_.size() - 1;
    Holders* holders = nullptr;
    for (std::size_t i = 0; i < keys.size(); ++i) {
        const PageKey key = keys[i];
        if (key == 0) {
            continue;
        }
        if (holders == nullptr || holders->key != key) { // neighbours often hold the same page
            std::size_t at = (key * 0x9e37'79b9'7f4a'7c15 >> 32) & mask;
            while (table_[at].page == page_ && table_[at].key != key) {
                at = (at + 1) & mask;
            }
            holders = &table_[at];
            if (holders->page != page_) {
                *holders = {key, page_, 0, 0};
                used_.push_back(static_cast<std::uint32_t>(at));
            }
        }
        holders->signature ^= memberSignatures_[members[i]];
        ++holders->count;
    }
    for (const std::uint32_t at : used_) {
        const Holders& found = table_[at];
        if (found.count > 1) {
            const bool isResident = (found.key & residentKey) != 0;
            count(setOf(found.signature, found.key, members, keys), isResident ? pages : 0,
                  isResident ? 0 : pages);
        }
    }
}

std::size_t SharingSets::setOf(std::uint64_t signature, PageKey key, std::span<const std::uint32_t> members,
                               std::span<const PageKey> keys) {
    if (signature == lastSignature_ && !sets_.empty()) {
        return lastSet_;
    }
    lastSet_ = numberOf(signature);
    lastSignature_ = signature;
    if (sets_[lastSet_].empty()) {
        for (std::size_t i = 0; i < keys.size(); ++i) {
            if (keys[i] == key) {
                sets_[lastSet_].push_back(members[i]);
            }
        }
    }
    return lastSet_;
}

/// The number of the set, which is new and empty when it was not met before.
std::size_t SharingSets::numberOf(std::uint64_t signature) {
    const auto [entry, isNew] = setBySignature_.try_emplace(signature, sets_.size());
    if (isNew) {
        sets_.emplace_back();
        signatures_.push_back(signature);
    }
    return entry->second;
}

void SharingSets::absorb(SharingSets& other) {
    for (const SetPages& pages : other.takeCounts()) {
        begin(pages.slot);
        const std::size_t set = numberOf(other.signatures_[pages.set]);
        if (sets_[set].empty()) {
            sets_[set] = other.sets_[pages.set];
        }
        count(set, pages.resident, pages.swapped);
    }
}

void SharingSets::count(std::size_t set, std::uint64_t resident, std::uint64_t swapped) {
    if (set >= inSlot_.size()) {
        inSlot_.resize(set + 1);
    }
    SetPages& pages = inSlot_[set];
    if (pages.resident + pages.swapped == 0) {
        pages = {.slot = slot_, .set = set};
        touched_.push_back(set);
    }
    pages.resident += resident;
    pages.swapped += swapped;
}

/// Goes over to `slot`.
void SharingSets::begin(std::size_t slot) {
    if (slot != slot_) {
        flush();
        slot_ = slot;
    }
}

void SharingSets::flush() {
    std::sort(touched_.begin(), touched_.end());
    for (const std::size_t set : touched_) {
        counts_.push_back(inSlot_[set]);
        inSlot_[set] = {};
    }
    touched_.clear();
}

std::vector<SetPages> SharingSets::takeCounts() {
    flush();
    return std::move(counts_);
}

} // namespace tally::platform
