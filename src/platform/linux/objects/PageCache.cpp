#include "platform/linux/objects/PageCache.h"

#include "platform/linux/pages/Mapping.h"

#include <linux/magic.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <limits>

namespace tally::platform {

namespace {

// As the kernel lays them out (include/uapi/linux/mman.h of 6.5); the installed headers are older.
struct cachestat_range {
    std::uint64_t off;
    std::uint64_t len;
};
struct cachestat_counts {
    std::uint64_t nr_cache;
    std::uint64_t nr_dirty;
    std::uint64_t nr_writeback;
    std::uint64_t nr_evicted;
    std::uint64_t nr_recently_evicted;
};
constexpr long cachestatCall = 451;

/// Counts the pages of `range` that are in memory. Mapping a file touches none of them.
std::optional<std::uint64_t> pagesInMemory(const Descriptor& file, AddressRange range) {
    std::array<unsigned char, 16384> isHere{}; // by page; 1 in the lowest bit
    std::uint64_t count = 0;
    while (range.start < range.end) {
        const std::size_t length = std::min(range.end - range.start, isHere.size() * basePage);
        const std::size_t pages = wholePages(length) / basePage;
        void* const memory =
            mmap(nullptr, length, PROT_READ, MAP_SHARED, file.number(), static_cast<off_t>(range.start));
        const bool isAnswered = memory != MAP_FAILED && mincore(memory, length, isHere.data()) == 0;
        if (memory != MAP_FAILED) {
            munmap(memory, length);
        }
        if (!isAnswered) {
            return std::nullopt;
        }
        count += static_cast<std::uint64_t>(std::count_if(
            isHere.begin(), isHere.begin() + pages, [](unsigned char here) { return (here & 1) != 0; }));
        range.start += length;
    }
    return count;
}

/// The same for shared memory by older calls: what has no hole is there, in memory or swapped out.
std::optional<CachedPages> sharedMemoryPages(const Descriptor& file, AddressRange range) {
    struct statfs system {};
    if (fstatfs(file.number(), &system) != 0 || system.f_type != TMPFS_MAGIC) {
        errno = EOPNOTSUPP;
        return std::nullopt;
    }
    CachedPages pages;
    while (range.start < range.end) {
        const off_t data = lseek(file.number(), static_cast<off_t>(range.start), SEEK_DATA);
        const off_t hole = data < 0 ? data : lseek(file.number(), data, SEEK_HOLE);
        if (hole < 0) {
            return errno == ENXIO ? std::optional(pages) : std::nullopt; // no data up to the end
        }
        const AddressRange found{std::min(static_cast<std::uint64_t>(data), range.end),
                                 std::min(static_cast<std::uint64_t>(hole), range.end)};
        const std::optional<std::uint64_t> here = pagesInMemory(file, found);
        if (!here) {
            return std::nullopt;
        }
        pages.cached += *here;
        pages.evicted += wholePages(found.end - found.start) / basePage - *here;
        range.start = static_cast<std::uint64_t>(hole);
    }
    return pages;
}

} // namespace

std::optional<CachedPages> cachedPages(const Descriptor& file, std::uint64_t offset, std::uint64_t length) {
    if (length == 0) {
        return CachedPages(); // to the kernel a length of 0 is everything to the end
    }
    if (!file.isOpen()) {
        return std::nullopt;
    }
    cachestat_range range{offset, length};
    cachestat_counts counts{};
    if (syscall(cachestatCall, file.number(), &range, &counts, 0) != 0) {
        return std::nullopt;
    }
    return CachedPages{counts.nr_cache, counts.nr_dirty + counts.nr_writeback, counts.nr_evicted};
}

std::optional<CachedPages> cachedOrHeldPages(const Descriptor& file, std::uint64_t offset,
                                             std::uint64_t length) {
    const std::optional<CachedPages> pages = cachedPages(file, offset, length);
    if (pages || !file.isOpen() || (errno != ENOSYS && errno != EPERM)) {
        return pages;
    }
    constexpr std::uint64_t last = std::numeric_limits<off_t>::max();
    const std::uint64_t start = std::min(offset, last);
    return sharedMemoryPages(file, {start, start + std::min(length, last - start)});
}

} // namespace tally::platform
