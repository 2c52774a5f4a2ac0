#include "platform/linux/walk/PageScan.h"

#include "platform/linux/walk/Mapping.h"

#include <sys/ioctl.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <thread>

namespace tally::platform {

namespace {

struct pm_scan_arg {
    std::uint64_t size;
    std::uint64_t flags;
    std::uint64_t start;
    std::uint64_t end;
    std::uint64_t walk_end;
    std::uint64_t vec;
    std::uint64_t vec_len;
    std::uint64_t max_pages;
    std::uint64_t category_inverted;
    std::uint64_t category_mask;
    std::uint64_t category_anyof_mask;
    std::uint64_t return_mask;
};
static_assert(sizeof(pm_scan_arg) == 96);

constexpr unsigned long PAGEMAP_SCAN = _IOWR('f', 16, pm_scan_arg);
constexpr std::uint64_t mostPages = (64 << 20) / basePage;
// Of a call that gives more regions than this, the kernel's own note of where it ended is stale (seen
// on 6.18).
constexpr std::size_t mostRegions = 512;

/// A thread that waits to change the address space is only woken when a scan ends: the next one would take
/// the lock before it, again and again, for milliseconds.
void letWaitersIn() { std::this_thread::sleep_for(std::chrono::microseconds(1)); }

/// Makes the call. @return the number of regions; negative with errno.
int askForPages(int pagemap, pm_scan_arg& query, std::span<PageRegion> room) {
    static std::atomic<bool> tellsGuards = true; // false once this kernel has refused the category
    query.size = sizeof(query);
    query.vec = reinterpret_cast<std::uintptr_t>(room.data());
    query.vec_len = room.size();
    query.category_anyof_mask = PageIsPresent | PageIsSwapped;
    query.return_mask |= PageIsPresent | PageIsSwapped;
    for (;;) {
        const bool withGuards = tellsGuards;
        query.return_mask = withGuards ? query.return_mask | PageIsGuard : query.return_mask & ~PageIsGuard;
        const int count = ioctl(pagemap, PAGEMAP_SCAN, &query);
        if (count < 0 && errno == EINVAL && withGuards) {
            tellsGuards = false;
        } else if (count >= 0 || errno != EINTR) {
            return count;
        }
    }
}

} // namespace

int scanPages(int pagemap, std::uint64_t start, std::uint64_t end, bool withFile, std::span<PageRegion> room,
              PageScanStep* step) {
    const std::span<PageRegion> used = room.first(std::min(room.size(), mostRegions));
    pm_scan_arg query{};
    query.start = start;
    query.end = end;
    query.max_pages = mostPages;
    query.return_mask = PageIsZero | PageIsHuge | (withFile ? PageIsFile : 0);
    const int count = askForPages(pagemap, query, used);
    if (count < 0) {
        return errno;
    }
    step->regions = used.first(static_cast<std::size_t>(count));
    std::uint64_t pages = 0;
    for (const PageRegion& region : step->regions) {
        pages += (region.end - region.start) / basePage;
    }
    const bool complete = step->regions.size() < used.size() && pages < mostPages;
    step->resume = complete ? end : step->regions.back().end;
    if (pages >= mostPages && step->resume < end) {
        letWaitersIn();
    }
    return 0;
}

int findPage(int pagemap, std::uint64_t start, std::uint64_t end, std::uint64_t* found) {
    PageRegion first;
    pm_scan_arg query{};
    query.start = start;
    query.end = end;
    query.max_pages = 1;
    const int count = askForPages(pagemap, query, std::span(&first, 1));
    if (count < 0) {
        return errno;
    }
    *found = count == 0 ? end : std::max(start, first.start);
    return 0;
}

} // namespace tally::platform
