#include "platform/linux/pages/PageScan.h"

#include "platform/linux/pages/Mapping.h"

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
// Of a call that gives more regions than this, the kernel's own note of where it ended is stale (seen
// on 6.18).
constexpr std::size_t mostRegions = 512;

/// A thread that waits to change the address space is only woken when a scan ends: the next one would take
/// the lock before it, again and again, for milliseconds.
void letWaitersIn() { std::this_thread::sleep_for(std::chrono::microseconds(1)); }

/// Whether what a filter answers in the place of the kernel says that there is no such query.
bool saysUnknown(int error) { return error == EPERM || error == EACCES || error == ENOSYS; }

} // namespace

int scanPages(int pagemap, AddressRange range, bool withFile, std::uint64_t mostPages,
              std::span<PageRegion> room, PageScanStep* step) {
    static std::atomic<bool> tellsGuards = true; // false once this kernel has refused the category
    const std::span<PageRegion> used = room.first(std::min(room.size(), mostRegions));
    for (bool isSecond = false;; isSecond = true) {
        const bool withGuards = tellsGuards;
        pm_scan_arg query{};
        query.size = sizeof(query);
        query.start = range.start;
        query.end = range.end;
        query.vec = reinterpret_cast<std::uintptr_t>(used.data());
        query.vec_len = used.size();
        query.max_pages = mostPages;
        query.category_anyof_mask = pageIsPresent | pageIsSwapped;
        query.return_mask = pageIsPresent | pageIsSwapped | pageIsZero | pageIsHuge |
                            (withFile ? pageIsFile : 0) | (withGuards ? pageIsGuard : 0);
        const int count = ioctl(pagemap, PAGEMAP_SCAN, &query);
        if (count < 0 && errno == EINVAL && withGuards) {
            tellsGuards = false;
            continue;
        }
        if (count < 0 && (isSecond || errno == ESRCH || errno == ENOTTY) && errno != EINTR) {
            return saysUnknown(errno) ? ENOTTY : errno;
        }
        if (count < 0) {
            continue;
        }
        step->regions = used.first(static_cast<std::size_t>(count));
        step->pages = 0;
        for (const PageRegion& region : step->regions) {
            step->pages += (region.end - region.start) / basePage;
        }
        const bool complete = step->regions.size() < used.size() && step->pages < mostPages;
        step->resume = complete ? range.end : step->regions.back().end;
        if (step->pages >= mostPagesOfCall && step->resume < range.end) {
            letWaitersIn();
        }
        return 0;
    }
}

} // namespace tally::platform
