#include "vm/PageClassification.h"

#include "base/Assertion.h"
#include "vm/PageRounding.h"
#include "vm/TLRangeList.h"

#include <algorithm>
#include <array>
#include <span>

namespace tally {

using namespace platform;

namespace {

constexpr std::uint64_t pagesPerQuery = 4096;
constexpr std::uint64_t pagesBehindGap = 64; // of the first query there; of each that follows twice as many

/// Asks for the state of `pageCount` pages from `start` on and calls handler(words, index of the first of
/// them) for each chunk of them. Of what is absent behind a chunk only the last page is told: what is only
/// reserved can be a billion times what is there.
/// @return false, with the error recorded, when the kernel refuses.
template <typename Handler>
bool queryPageDispositions(WalkedTask& task, std::uint64_t start, std::uint64_t pageCount,
                           Handler&& handler) {
    std::array<std::int32_t, pagesPerQuery> words;
    std::uint64_t wanted = pagesPerQuery;
    for (std::uint64_t first = 0; first < pageCount;) {
        std::uint64_t count = std::min(pageCount - first, wanted);
        const std::span<std::int32_t> chunk = std::span(words).first(count);
        const std::uint64_t address = start + first * task.pageSize;
        const kern_return_t status =
            mach_vm_page_range_query(task.task, address, count * task.pageSize, chunk, &count);
        if (status != KERN_SUCCESS) {
            mach_error("mach_vm_page_range_query", status);
            task.recordRegionError(status);
            return false;
        }
        handler(std::span<const std::int32_t>(chunk.first(count)), first);
        first += chunk.size();
        wanted = std::min(2 * wanted, pagesPerQuery);
        if (first < pageCount) {
            const std::uint64_t next = mach_vm_next_page(task.task, start + first * task.pageSize,
                                                         start + pageCount * task.pageSize);
            const std::uint64_t index = std::min((next - start) / task.pageSize, pageCount - 1);
            wanted = index == first ? wanted : pagesBehindGap;
            first = index;
        }
    }
    return true;
}

/// Adds `bytes` of a page to what it holds: anonymous pages count as dirty whether written or not.
void addBytesOfPage(TLRangeSizes& sizes, std::int32_t disposition, std::uint64_t bytes) {
    const bool isAnonymous = (disposition & (VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL)) ==
                             VM_PAGE_QUERY_PAGE_PRESENT;
    if ((disposition & VM_PAGE_QUERY_PAGE_DIRTY) != 0 || isAnonymous) {
        sizes.dirty += bytes;
    } else if ((disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0) {
        sizes.swapped += bytes;
    }
}

/// Bytes of `region` in its first page.
std::uint64_t bytesInFirstPage(const TLMemoryRegion& region, std::uint64_t pageSize) {
    return std::min(pageSize - (region.start - roundDownToPage(region.start, pageSize)), region.size);
}

/// Bytes of `region` in its last page.
std::uint64_t bytesInLastPage(const TLMemoryRegion& region, std::uint64_t pageSize) {
    return std::min(pageSize - (roundUpToPage(region.end(), pageSize) - region.end()), region.size);
}

/// Gives the gap that ends where `region` begins its bytes of the page in which they meet.
void settlePendingGap(WalkedTask& task, const TLMemoryRegion& region, std::int32_t disposition) {
    auto& pending = task.pendingUnusedSharedRegion;
    if (!pending) {
        return;
    }
    TLMemoryRegion& gap = task.regions[*pending];
    tl_assert(gap.end() == region.start, "self.pendingUnusedSharedRegion.end == region.start");
    TLRangeSizes share;
    addBytesOfPage(share, disposition, bytesInLastPage(gap, task.pageSize));
    gap.dirtySize += share.dirty;
    gap.swappedSize += share.swapped;
    pending.reset();
}

/// Neighbouring pages of a mapping that are in one state.
class PageRun {
  public:
    enum class Kind { absent, dirty, swapped, reclaimable, clean };

    PageRun(TLMemoryRegion& region, std::uint64_t pageSize)
        : region_(region), pageSize_(pageSize), start_(region.offset) {}

    void addPage(Kind kind) {
        if (kind != kind_) {
            finish();
            kind_ = kind;
        }
        (kind == Kind::absent ? start_ : length_) += pageSize_;
    }

    /// Passes over pages that are absent.
    void skip(std::uint64_t pages) {
        if (pages != 0) {
            finish();
            kind_ = Kind::absent;
            start_ += pages * pageSize_;
        }
    }

    /// Hands the run to the region, unless it is one of absent pages.
    void finish() {
        if (length_ == 0) {
            return;
        }
        const auto bytesIf = [this](Kind kind) { return kind_ == kind ? length_ : 0; };
        region_.addSubrange(start_, length_,
                            {.dirty = bytesIf(Kind::dirty),
                             .swapped = bytesIf(Kind::swapped),
                             .clean = bytesIf(Kind::clean),
                             .reclaimable = bytesIf(Kind::reclaimable),
                             .wired = region_.wired ? length_ : 0},
                            pageSize_);
        start_ += length_;
        length_ = 0;
    }

  private:
    TLMemoryRegion& region_;
    std::uint64_t pageSize_;
    std::uint64_t start_; // offset in the VM object
    std::uint64_t length_ = 0;
    Kind kind_ = Kind::absent;
};

PageRun::Kind kindOfPage(std::int32_t disposition, std::int32_t reclaimableMask) {
    using enum PageRun::Kind;
    return (disposition & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0 ? swapped
           : (disposition & VM_PAGE_QUERY_PAGE_DIRTY) != 0   ? dirty
           : (disposition & reclaimableMask) != 0            ? reclaimable
           : (disposition & VM_PAGE_QUERY_PAGE_PRESENT) != 0 ? clean
                                                             : absent;
}

} // namespace

bool populateMemoryRegionWithPageQueries(WalkedTask& task, TLMemoryRegion& region) {
    tl_assert(region.dirtySize == 0 && region.swappedSize == 0,
              "region.dirtySize == 0 && region.swappedSize == 0");
    const std::uint64_t pageSize = task.pageSize;
    const std::uint64_t firstPage = roundDownToPage(region.start, pageSize);
    const std::uint64_t pagesEnd = roundUpToPage(region.end(), pageSize);
    const std::uint64_t pageCount = (pagesEnd - firstPage) / pageSize;
    const bool startsInsidePage = region.start != firstPage;
    const bool endsInsidePage = region.end() != pagesEnd;

    TLRangeSizes sizes;
    const bool firstIsCached = firstPage == task.cachedDispositionAddress;
    if (firstIsCached) {
        addBytesOfPage(sizes, task.cachedDisposition, bytesInFirstPage(region, pageSize));
    }
    const std::uint64_t known = firstIsCached ? 1 : 0; // pages that need not be asked for
    if (region.unusedSharedCacheRegion) {
        region.dirtySize = sizes.dirty;
        region.swappedSize = sizes.swapped;
        if (endsInsidePage && pageCount > known) {
            task.pendingUnusedSharedRegion = task.regions.size() - 1;
        }
        return true;
    }
    const auto addPage = [&](std::uint64_t index, std::int32_t disposition) {
        std::uint64_t bytes = pageSize;
        if (index == 0 && startsInsidePage) {
            bytes = bytesInFirstPage(region, pageSize);
            settlePendingGap(task, region, disposition);
        }
        if (index == pageCount - 1 && endsInsidePage) {
            bytes = bytesInLastPage(region, pageSize);
            task.cachedDispositionAddress = pagesEnd - pageSize;
            task.cachedDisposition = disposition;
        }
        addBytesOfPage(sizes, disposition, bytes);
    };
    const bool answered =
        queryPageDispositions(task, firstPage + known * pageSize, pageCount - known,
                              [&](std::span<const std::int32_t> words, std::uint64_t first) {
                                  for (std::size_t i = 0; i < words.size(); ++i) {
                                      addPage(known + first + i, words[i]);
                                  }
                              });
    region.swappedSize = sizes.swapped;
    region.dirtySize = sizes.dirty;
    return answered;
}

void addSubrangesForRegion(WalkedTask& task, TLMemoryRegion& region, int purgeState) {
    tl_assert(!region.ownedExclusivelyByParentProcess, "!region.ownedExclusivelyByParentProcess");
    const std::uint64_t pageSize = task.pageSize;
    const std::uint64_t firstPage = roundDownToPage(region.start, pageSize);
    const std::uint64_t pageCount = (roundUpToPage(region.end(), pageSize) - firstPage) / pageSize;
    const std::int32_t reclaimableMask =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;

    PageRun run(region, pageSize);
    std::uint64_t next = 0;
    const bool answered = queryPageDispositions(
        task, firstPage, pageCount, [&](std::span<const std::int32_t> words, std::uint64_t first) {
            run.skip(first - next);
            next = first + words.size();
            for (const std::int32_t disposition : words) {
                run.addPage(kindOfPage(disposition, reclaimableMask));
            }
        });
    run.finish();
    if (!answered) { // the region's own sizes are worth more than some of its runs
        region.subrangeList.reset();
    }
}

} // namespace tally
