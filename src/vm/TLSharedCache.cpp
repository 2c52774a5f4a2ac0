#include "vm/TLSharedCache.h"

#include <cstdio>
#include <map>
#include <mutex>
#include <utility>

namespace tally {

using namespace platform;

std::shared_ptr<const TLSharedCache> TLSharedCache::sharedCacheForTask(mach_port_t task) {
    kern_return_t processStatus = KERN_SUCCESS;
    kern_return_t snapshotStatus = KERN_SUCCESS;
    const auto cache = dyld_shared_cache_for_task(task, &processStatus, &snapshotStatus);
    if (processStatus != KERN_SUCCESS) {
        std::fprintf(stderr, "Unable to create dyld process: %s", mach_error_string(processStatus));
        return nullptr;
    }
    if (snapshotStatus != KERN_SUCCESS) {
        std::fprintf(stderr, "Unable to create dyld process snapshot: %s", mach_error_string(snapshotStatus));
        return nullptr;
    }
    if (!cache || cache->mapped_private) {
        return nullptr;
    }
    static std::mutex mutex;
    static std::map<std::pair<uuid_t, std::uint64_t>, std::shared_ptr<const TLSharedCache>> sharedCacheTable;
    const std::scoped_lock lock(mutex);
    auto& record = sharedCacheTable[{cache->uuid, cache->base_address}];
    if (!record) {
        record = std::make_shared<TLSharedCache>(TLSharedCache{
            .uuid = cache->uuid, .baseAddress = cache->base_address, .mappedSize = cache->mapped_size});
    }
    return record;
}

} // namespace tally
