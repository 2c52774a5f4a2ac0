#include "platform/linux/walk/CountedPages.h"

#include <algorithm>
#include <tuple>

namespace tally::platform {

void CountedPages::prepare() {
    std::sort(expected_.begin(), expected_.end(), [](const Expected& a, const Expected& b) {
        return std::tie(a.id, a.range.first) < std::tie(b.id, b.range.first);
    });
    std::uint64_t end = 0; // of what the object's ranges so far reach
    for (std::size_t i = 0; i < expected_.size(); ++i) {
        const bool sameObject = i > 0 && expected_[i - 1].id == expected_[i].id;
        if (sameObject && expected_[i].range.first < end) {
            counted_.try_emplace(expected_[i].id);
        }
        end = sameObject ? std::max(end, expected_[i].range.end) : expected_[i].range.end;
    }
    expected_ = {};
}

void CountedPages::take(std::uint64_t id, PageRange range, std::vector<PageRange>* fresh) {
    const auto object = counted_.find(id);
    if (object == counted_.end()) {
        fresh->push_back(range);
        return;
    }
    Ranges& ranges = object->second;
    auto next = ranges.upper_bound(range.first);
    if (next != ranges.begin() && std::prev(next)->second > range.first) {
        range.first = std::min(range.end, std::prev(next)->second);
    }
    // Fill the gaps between the ranges that overlap.
    while (range.first < range.end) {
        const std::uint64_t end = next == ranges.end() ? range.end : std::min(range.end, next->first);
        if (range.first < end) {
            fresh->push_back({range.first, end});
            ranges.emplace_hint(next, range.first, end);
        }
        if (next == ranges.end() || next->first >= range.end) {
            break;
        }
        range.first = next->second;
        ++next;
    }
}

} // namespace tally::platform
