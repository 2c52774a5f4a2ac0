#include "platform/scripted/ScriptedTask.h"

#include "base/Format.h"

#include <algorithm>
#include <iterator>
#include <stdexcept>

namespace tally::platform {

namespace {

constexpr std::int32_t present = VM_PAGE_QUERY_PAGE_PRESENT;

std::int32_t wordOfLetter(char letter, bool external) {
    const std::int32_t ofTheFile = external ? VM_PAGE_QUERY_PAGE_EXTERNAL : 0;
    switch (letter) {
    case '.':
        return 0;
    case 'D':
        return present | VM_PAGE_QUERY_PAGE_DIRTY | ofTheFile;
    case 'C':
        return present | ofTheFile;
    case 'A':
        return present;
    case 'R':
        return present | VM_PAGE_QUERY_PAGE_REUSABLE | ofTheFile;
    case 'S':
        return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    default:
        throw std::invalid_argument(formatted("'%c' is no page state", letter));
    }
}

/// Letter of page `index` where only `counts` are given: dirty pages come first, then clean, reusable and
/// swapped ones.
char letterForCounts(const PageCounts& counts, std::size_t index) {
    const std::size_t dirty = std::min(counts.dirtied, counts.resident);
    const std::size_t reusable = std::min<std::size_t>(counts.reusable, counts.resident - dirty);
    return index < dirty                              ? 'D'
           : index < counts.resident - reusable       ? 'C'
           : index < counts.resident                  ? 'R'
           : index - counts.resident < counts.swapped ? 'S'
                                                      : '.';
}

const PageStates& statesOf(const ScriptedMapping& mapping, View view) {
    return view == View::object && mapping.objectPages ? *mapping.objectPages : mapping.pages;
}

} // namespace

std::int32_t pageWord(const ScriptedMapping& mapping, View view, std::size_t index) {
    const PageStates& states = statesOf(mapping, view);
    if (!states.words.empty()) {
        return index < states.words.size() ? states.words[index] : 0;
    }
    char letter = '.';
    if (index < states.letters.size()) {
        letter = states.letters[index];
    } else if (states.letters.empty() && states.counts) {
        letter = letterForCounts(*states.counts, index);
    }
    return wordOfLetter(letter, mapping.hasExternalPager());
}

PageCounts pageCounts(const ScriptedMapping& mapping, View view) {
    const PageStates& states = statesOf(mapping, view);
    if (states.counts) {
        return *states.counts;
    }
    PageCounts counts;
    for (std::size_t index = 0; index < states.length(); ++index) {
        const std::int32_t word = pageWord(mapping, view, index);
        const bool isPresent = (word & present) != 0;
        counts.resident += isPresent ? 1 : 0;
        counts.dirtied += (word & VM_PAGE_QUERY_PAGE_DIRTY) != 0 ? 1 : 0;
        counts.reusable += isPresent && (word & VM_PAGE_QUERY_PAGE_REUSABLE) != 0 ? 1 : 0;
        counts.swapped += (word & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0 ? 1 : 0;
    }
    return counts;
}

ScriptedMapping& ScriptedTask::map(ScriptedMapping mapping) {
    settle(mapping, mappings_.empty() ? 0x10000 : mappings_.rbegin()->second.end());
    const std::uint64_t start = *mapping.start;
    const auto next = mappings_.lower_bound(start);
    const bool meetsNext = next != mappings_.end() && mapping.end() > next->first;
    const bool meetsPrevious = next != mappings_.begin() && std::prev(next)->second.end() > start;
    if (meetsNext || meetsPrevious) {
        throw std::invalid_argument(formatted("two mappings meet at %#llx", static_cast<long long>(start)));
    }
    return mappings_.emplace_hint(next, start, std::move(mapping))->second;
}

/// Fills in what `mapping` leaves to its surroundings, and its nested mappings likewise.
void ScriptedTask::settle(ScriptedMapping& mapping, std::uint64_t previousEnd) {
    if (!mapping.start) {
        mapping.start = previousEnd;
    }
    std::uint64_t at = *mapping.start;
    for (ScriptedMapping& inner : mapping.nested) {
        settle(inner, at);
        if (*inner.start < at) {
            throw std::invalid_argument("nested mappings must rise within their submap");
        }
        at = inner.end();
    }
    if (mapping.size == 0) {
        const std::size_t pages =
            std::max(mapping.pages.length(), mapping.objectPages ? mapping.objectPages->length() : 0);
        mapping.size = mapping.nested.empty() ? pages * *pageSize_ : at - *mapping.start;
    }
    const bool isWhole = mapping.size % *pageSize_ == 0 && *mapping.start % *pageSize_ == 0;
    if (mapping.size == 0 || !isWhole || mapping.end() < at || mapping.end() < *mapping.start) {
        throw std::invalid_argument(formatted("no mapping: %#llx bytes at %#llx",
                                              static_cast<long long>(mapping.size),
                                              static_cast<long long>(*mapping.start)));
    }
    for (const char letter :
         mapping.pages.letters + (mapping.objectPages ? mapping.objectPages->letters : "")) {
        wordOfLetter(letter, false); // throws now rather than in a gather
    }
    if (!mapping.shareMode) {
        mapping.shareMode = mapping.object.value_or(0) != 0 ? SM_SHARED : SM_PRIVATE;
    }
    if (!mapping.object) {
        mapping.object = makeObjectId_();
    }
}

ScriptedTask::Place ScriptedTask::findMapping(std::uint64_t address, std::uint32_t depth) const {
    auto next = mappings_.upper_bound(address);
    if (next != mappings_.begin() && std::prev(next)->second.end() > address) {
        --next;
    }
    for (; next != mappings_.end(); ++next) {
        Place place{&next->second, 0};
        while (place.mapping != nullptr && place.depth < depth && !place.mapping->nested.empty()) {
            const auto& nested = place.mapping->nested;
            const auto inner = std::upper_bound(nested.begin(), nested.end(), address,
                                                [](std::uint64_t wanted, const ScriptedMapping& candidate) {
                                                    return wanted < candidate.end();
                                                });
            place = {inner == nested.end() ? nullptr : &*inner, place.depth + 1};
        }
        if (place.mapping != nullptr) {
            return place;
        }
    }
    return {};
}

} // namespace tally::platform
