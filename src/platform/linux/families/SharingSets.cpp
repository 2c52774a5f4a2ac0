#include "platform/linux/families/SharingSets.h"

#include <algorithm>
#include <bit>
#include <random>

namespace tally::platform {

SharingSets::SharingSets(std::size_t members) {
    // Two different sets of some 15,000 get one signature with a chance of 1 in 10^11.
    std::mt19937_64 random(0x7461'6c6c'7921);
    for (std::size_t i = 0; i < members; ++i) {
        memberSignatures_.push_back(random());
    }
    table_.resize(std::bit_ceil(members * 2 + 1));
}

void SharingSets::addPage(std::size_t slot, std::span<const std::uint32_t> members,
                          std::span<const PageKey> keys) {
    if (slot != slot_) {
        flush();
        slot_ = slot;
    }
    ++page_;
    used_.clear();
    const std::size_t mask = table_.size() - 1;
    for (std::size_t i = 0; i < keys.size(); ++i) {
        const PageKey key = keys[i];
        if (key == 0) {
            continue;
        }
        std::size_t at = (key * 0x9e3779b97f4a7c15 >> 32) & mask;
        while (table_[at].page == page_ && table_[at].key != key) {
            at = (at + 1) & mask;
        }
        Holders& holders = table_[at];
        if (holders.page != page_) {
            holders = {key, page_, 0, 0};
            used_.push_back(static_cast<std::uint32_t>(at));
        }
        holders.signature ^= memberSignatures_[members[i]];
        ++holders.count;
    }
    for (const std::uint32_t at : used_) {
        if (table_[at].count > 1) {
            count(slot, setOf(table_[at].signature, table_[at].key, members, keys), table_[at].key);
        }
    }
}

std::size_t SharingSets::setOf(std::uint64_t signature, PageKey key, std::span<const std::uint32_t> members,
                               std::span<const PageKey> keys) {
    if (signature == lastSignature_ && !sets_.empty()) {
        return lastSet_;
    }
    const auto [entry, isNew] = setBySignature_.try_emplace(signature, sets_.size());
    if (isNew) {
        std::vector<std::uint32_t> holders;
        for (std::size_t i = 0; i < keys.size(); ++i) {
            if (keys[i] == key) {
                holders.push_back(members[i]);
            }
        }
        sets_.push_back(std::move(holders));
    }
    lastSignature_ = signature;
    lastSet_ = entry->second;
    return lastSet_;
}

void SharingSets::count(std::size_t slot, std::size_t set, PageKey key) {
    if (set >= inSlot_.size()) {
        inSlot_.resize(set + 1);
    }
    SetPages& pages = inSlot_[set];
    if (pages.resident + pages.swapped == 0) {
        pages = {.slot = slot, .set = set};
        touched_.push_back(set);
    }
    ++((key & residentKey) != 0 ? pages.resident : pages.swapped);
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
