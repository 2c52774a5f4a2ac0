#include "platform/linux/owned/SysVSegments.h"

#include "platform/linux/io/TextScan.h"

#include <array>

namespace tally::platform {

std::vector<SysVSegment> decodeSysVSegments(std::string_view text) {
    // key shmid perms size cpid lpid nattch uid gid cuid cgid atime dtime ctime rss swap
    enum Column { id = 1, size = 3, creator = 4, changed = 13, resident = 14, swapped = 15, columns };
    std::vector<SysVSegment> segments;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        std::array<std::int64_t, columns> values{};
        std::size_t count = 0;
        while (count < columns && takeNumber(line, &values[count])) {
            ++count;
        }
        if (count == columns) {
            segments.push_back({.id = static_cast<std::uint64_t>(values[id]),
                                .creator = static_cast<std::int32_t>(values[creator]),
                                .changed = values[changed],
                                .size = static_cast<std::uint64_t>(values[size]),
                                .resident = static_cast<std::uint64_t>(values[resident]),
                                .swapped = static_cast<std::uint64_t>(values[swapped])});
        }
    }
    return segments;
}

} // namespace tally::platform
