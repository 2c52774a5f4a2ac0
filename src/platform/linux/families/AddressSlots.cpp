#include "platform/linux/families/AddressSlots.h"

#include <algorithm>

namespace tally::platform {

std::vector<AddressSlot> addressSlots(std::span<const AddressRange> ranges) {
    std::vector<AddressRange> byStart(ranges.begin(), ranges.end());
    std::sort(byStart.begin(), byStart.end(),
              [](const AddressRange& a, const AddressRange& b) { return a.start < b.start; });
    std::vector<AddressSlot> slots;
    std::vector<std::uint64_t> borders;
    std::size_t cluster = 0;
    for (std::size_t first = 0; first < byStart.size(); ++cluster) {
        // A cluster reaches as far as ranges overlap; ranges that only touch are two.
        std::uint64_t end = byStart[first].end;
        borders.clear();
        std::size_t next = first;
        for (; next < byStart.size() && (next == first || byStart[next].start < end); ++next) {
            end = std::max(end, byStart[next].end);
            borders.push_back(byStart[next].start);
            borders.push_back(byStart[next].end);
        }
        std::sort(borders.begin(), borders.end());
        borders.erase(std::unique(borders.begin(), borders.end()), borders.end());
        for (std::size_t i = 0; i + 1 < borders.size(); ++i) {
            slots.push_back({borders[i], borders[i + 1], cluster, borders.front()});
        }
        first = next;
    }
    return slots;
}

} // namespace tally::platform
