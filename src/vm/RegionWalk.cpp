#include "vm/RegionWalk.h"

#include "base/Assertion.h"
#include "base/Format.h"
#include "platform/bsd_process.h"

#include <algorithm>
#include <array>
#include <limits>

namespace tally {

using namespace platform;

namespace {

/// One walk: where it stands, and what it found last.
class RegionWalk {
  public:
    explicit RegionWalk(WalkedTask& task) : task_(task) {
        if (const auto& cache = task.sharedCache) {
            cacheBase_ = cache->baseAddress;
            cacheEnd_ = cache->baseAddress + cache->mappedSize;
        }
        lastPrivate_ = lastNonSharedCacheRegion(task);
    }

    /// Moves on to the next mapping. @return false when the walk has ended.
    bool next();

    const EnumeratedRegion& mapping() const { return mapping_; }

  private:
    bool isPastPrivateMappings() const {
        return mapping_.start < cacheEnd_ && lastPrivate_ != 0 && mapping_.start >= lastPrivate_;
    }
    bool isSharedCacheMapping() const {
        return mapping_.start >= lastPrivate_ && mapping_.start < cacheEnd_ && cacheBase_ < mapping_.end();
    }
    void describeSharedCacheMapping(const vm_region_basic_info_64& basic);
    bool descend();
    bool end(const char* label, kern_return_t status);

    WalkedTask& task_;
    std::uint64_t cacheBase_ = 0;
    std::uint64_t cacheEnd_ = 0;
    std::uint64_t lastPrivate_ = 0;
    bool seenUnmapped_ = false;
    EnumeratedRegion mapping_;
};

bool RegionWalk::next() {
    const std::uint64_t from = mapping_.end();
    mapping_ = EnumeratedRegion();
    mapping_.start = from;
    if (isPastPrivateMappings()) {
        vm_region_basic_info_64 basic;
        const kern_return_t status = mach_vm_region(task_.task, &mapping_.start, &mapping_.size, &basic);
        if (status != KERN_SUCCESS) {
            return end("mach_vm_region", status);
        }
        mapping_.start = std::max(mapping_.start, from);
        if (isSharedCacheMapping()) { // its submap is the same for every process: not worth descending into
            describeSharedCacheMapping(basic);
            return true;
        }
    }
    return descend();
}

void RegionWalk::describeSharedCacheMapping(const vm_region_basic_info_64& basic) {
    mapping_.info = {
        .protection = basic.protection,
        .max_protection = basic.max_protection,
        .inheritance = basic.inheritance,
        .offset = basic.offset,
        .external_pager = 1,
        .share_mode = SM_COW,
        .is_submap = basic.reserved,
        .behavior = basic.behavior,
        .object_id = 1,
        .user_wired_count = basic.user_wired_count,
        .object_id_full = 1,
    };
}

/// Asks for the next mapping, however many submaps it lies in, and what can be told of it.
bool RegionWalk::descend() {
    vm_region_submap_info_64& info = mapping_.info;
    std::uint32_t depth = std::numeric_limits<std::uint32_t>::max();
    std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
    const kern_return_t status =
        mach_vm_region_recurse(task_.task, &mapping_.start, &mapping_.size, &depth, &info, &count);
    if (count <= VM_REGION_SUBMAP_INFO_V1_COUNT_64) {
        info.object_id_full = info.object_id;
    }
    const bool isUnmapped = info.user_tag == TLUnmappedTag;
    if (status == KERN_INVALID_ADDRESS || (seenUnmapped_ && !isUnmapped)) {
        return false;
    }
    if (status != KERN_SUCCESS) {
        return end("mach_vm_region_recurse", status);
    }
    seenUnmapped_ = seenUnmapped_ || isUnmapped;
    if (mach_vm_purgable_get_state(task_.task, mapping_.start, &mapping_.purgeState) != KERN_SUCCESS) {
        mapping_.purgeState = VM_PURGABLE_DENY;
    }
    tl_assert(info.is_submap == 0, "!info.is_submap");
    if (info.external_pager != 0 && task_.isAlive) {
        std::array<char, 1024> name;
        const int length = proc_regionfilename(task_.pid, mapping_.start, name);
        if (length > 0) {
            mapping_.fileName.emplace(name.data(), static_cast<std::size_t>(length));
        }
    }
    return true;
}

/// Ends the walk; past the last mapping that is no error.
bool RegionWalk::end(const char* label, kern_return_t status) {
    if (status != KERN_INVALID_ADDRESS) {
        mach_error(label, status);
        announceBailOut(task_);
        task_.recordRegionError(status);
    }
    return false;
}

} // namespace

void enumerateRegions(WalkedTask& task, const RegionCallback& callback) {
    RegionWalk walk(task);
    while (walk.next()) {
        if (callback(walk.mapping())) {
            return;
        }
    }
}

std::uint64_t lastNonSharedCacheRegion(const WalkedTask& task) {
    constexpr std::uint64_t precision = 16 << 20;
    if (!task.sharedCache) {
        return 0;
    }
    const std::uint64_t cacheBase = task.sharedCache->baseAddress;
    std::uint64_t low = 0;
    std::uint64_t high = cacheBase;
    do {
        const std::uint64_t middle = low / 2 + high / 2;
        std::uint64_t address = middle;
        std::uint64_t size = 0;
        vm_region_basic_info_64 info;
        if (mach_vm_region(task.task, &address, &size, &info) != KERN_SUCCESS || address == low) {
            return low;
        }
        if (address + size > cacheBase) {
            high = middle - task.pageSize;
        } else {
            low = address;
        }
    } while (high - low > precision);
    return low;
}

void announceBailOut(const WalkedTask& task) {
    printLineToStandardError("bailing out for process " + task.displayString + "; data may be incomplete!");
}

} // namespace tally
