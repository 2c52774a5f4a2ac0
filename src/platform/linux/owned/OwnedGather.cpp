#include "platform/linux/owned/OwnedGather.h"

#include "platform/linux/io/Gather.h"
#include "platform/linux/io/SystemFiles.h"

#include <ctime>
#include <unistd.h>

#include <iterator>
#include <map>
#include <mutex>
#include <unordered_map>

namespace tally::platform {

namespace {

using SegmentsByCreator = std::multimap<std::int32_t, SysVSegment>;

SegmentsByCreator readSegments() {
    SegmentsByCreator segments;
    const auto text = readSystemFile(systemPath("/proc/sysvipc/shm"));
    for (const SysVSegment& segment : decodeSysVSegments(text.value_or(""))) {
        segments.emplace(segment.creator, segment);
    }
    return segments;
}

struct OwnedTable {
    std::mutex mutex;
    std::unordered_map<std::uint64_t, std::int32_t> listedBy; // object id to pid
    const SegmentsByCreator segments = readSegments();
};

std::int64_t secondsOf(clockid_t clock) {
    timespec now{};
    clock_gettime(clock, &now);
    return now.tv_sec;
}

/// When a process started, in seconds since 1970; a second early or late.
std::int64_t startTime(std::uint64_t startTicks) {
    return secondsOf(CLOCK_REALTIME) - secondsOf(CLOCK_BOOTTIME) +
           static_cast<std::int64_t>(startTicks) / sysconf(_SC_CLK_TCK);
}

} // namespace

bool claimOwnedObject(std::uint64_t objectId, std::int32_t pid) {
    OwnedTable* const table = Gather::table<OwnedTable>();
    if (table == nullptr) {
        return true;
    }
    const std::scoped_lock lock(table->mutex);
    return table->listedBy.try_emplace(objectId, pid).first->second == pid;
}

std::vector<SysVSegment> segmentsCreatedBy(std::int32_t pid, std::uint64_t startTicks) {
    const OwnedTable* const table = Gather::table<OwnedTable>();
    const SegmentsByCreator read = table == nullptr ? readSegments() : SegmentsByCreator();
    const auto [first, last] = (table == nullptr ? read : table->segments).equal_range(pid);
    std::vector<SysVSegment> segments;
    for (auto at = first; at != last; ++at) {
        constexpr std::int64_t slack = 1;
        if (startTime(startTicks) <= at->second.changed + slack) { // else the creator's pid was used again
            segments.push_back(at->second);
        }
    }
    return segments;
}

} // namespace tally::platform
