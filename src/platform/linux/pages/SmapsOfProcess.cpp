#include "platform/linux/pages/SmapsOfProcess.h"

#include "platform/linux/io/SystemFiles.h"

#include <algorithm>

namespace tally::platform {

bool SmapsOfProcess::isReadable() {
    std::call_once(isRead_, [this] {
        const Descriptor file = openForReading(folder_ + "/smaps");
        const auto take = [&](std::string_view lines) { decodeSmaps(lines, &entries_); };
        if (!file.isOpen() || !readLines(file, take)) {
            entries_.clear();
            isMissed_ = true;
        }
    });
    return !entries_.empty();
}

const SmapsEntry* SmapsOfProcess::entryFor(const Mapping& mapping) {
    if (!isReadable()) {
        return nullptr;
    }
    const auto found =
        std::lower_bound(entries_.begin(), entries_.end(), mapping.start,
                         [](const SmapsEntry& entry, std::uint64_t start) { return entry.start < start; });
    return found != entries_.end() && found->start == mapping.start ? &*found : nullptr;
}

} // namespace tally::platform
