// Memory objects across processes: which regions show the same kernel VM object.
//
// Files every region of every process under one object, so that pages which several processes map count once,
// then makes the objects' sizes final and sums what each displayed process is charged for.
// Cost: one table look-up per region. One thread, after gathering has ended.

#include "analysis/TLTally.h"
#include "base/Assertion.h"
#include "vm/PhysTallyCollection.h"

#include <unordered_set>

namespace tally {

namespace {

bool isTextOrLinkedit(const TLMemoryRegion& region) {
    return region.segment == TLSegmentKind::text || region.segment == TLSegmentKind::linkedit;
}

/// The key of a region of a shared library cache: its place in the cache, beginning at 1, since 0 means no
/// object. Data that a process has dirtied is an object of its own; all else is one object for every process
/// that uses the cache.
std::uint64_t sharedCacheKey(const TLMemoryRegion& region, const TLSharedCache& cache, std::int32_t pid) {
    const std::uint64_t key = region.start - cache.baseAddress + 1;
    const bool isOwnData = !isTextOrLinkedit(region) && (region.chargedSize() != 0);
    return isOwnData ? key ^ (static_cast<std::uint64_t>(pid) << 32) : key;
}

std::uint64_t sumOfRegions(const TLProcess& process) {
    std::uint64_t sum = 0;
    for (const TLMemoryRegion& region : process.memoryRegions()) {
        sum += region.chargedSize();
    }
    return sum;
}

std::uint64_t sumOfDistinctObjects(const TLProcess& process) {
    std::uint64_t sum = 0;
    std::unordered_set<const TLMemoryObject*> counted;
    for (const TLMemoryRegion& region : process.memoryRegions()) {
        if (counted.insert(region.memoryObject).second) {
            sum += region.memoryObject->totals.charged();
        }
    }
    return sum;
}

std::unique_ptr<TLRangeList> copyOf(const TLRangeList& ranges, std::uint64_t pageSize) {
    auto copy = std::make_unique<TLRangeList>();
    copy->mergeRangeList(ranges, pageSize);
    return copy;
}

} // namespace

TLMemoryObject& TLTally::MemoryObjectTables::objectForRegion(const TLMemoryRegion& region,
                                                             const TLProcess& process,
                                                             ObjectTable* sharedCacheTable) {
    ObjectTable* table = &memoryObjects;
    std::uint64_t key = region.object_id;
    if (region.inSharedCache) {
        tl_assert(sharedCacheTable != nullptr, "sharedCacheTable != nullptr");
        table = sharedCacheTable;
        key = sharedCacheKey(region, *process.sharedCache(), process.pid());
    } else if (region.segment == TLSegmentKind::linkedit) {
        table = &linkeditMemoryObjects;
    } else if (region.segment == TLSegmentKind::text) {
        table = &textMemoryObjects;
    }
    if (key == 0 || key == TLNotSet) {
        return *uniqueMemoryObjects.emplace_back(makeObject());
    }
    std::shared_ptr<TLMemoryObject>& object = (*table)[key];
    if (!object) {
        object = makeObject();
    }
    return *object;
}

std::shared_ptr<TLMemoryObject> TLTally::MemoryObjectTables::makeObject() const {
    return std::allocate_shared<TLMemoryObject>(std::pmr::polymorphic_allocator<TLMemoryObject>(objects));
}

void TLTally::MemoryObjectTables::finalizeSizes() {
    const auto finalizeTable = [](ObjectTable& table) {
        for (auto& [key, object] : table) {
            object->finalizeSizes(false);
        }
    };
    finalizeTable(memoryObjects);
    for (const auto& object : uniqueMemoryObjects) {
        object->finalizeSizes(false);
    }
    finalizeTable(textMemoryObjects);
    finalizeTable(linkeditMemoryObjects);
    for (auto& [uuid, table] : sharedCacheMemoryObjects) {
        finalizeTable(table);
    }
}

void TLTally::analyzeMemoryObjects() {
    tables_.reset();
    arena_ = std::make_unique<std::pmr::monotonic_buffer_resource>();
    MemoryObjectTables& tables = tables_.emplace(arena_.get());
    tables.memoryObjects.reserve(100 * processes_.size());
    tables.textMemoryObjects.reserve(2 * processes_.size());
    tables.linkeditMemoryObjects.reserve(2 * processes_.size());

    const bool asCharged = tally::physTallyCollectionEnabled();
    for (const auto& process : processes_) {
        const auto& cache = process->sharedCache();
        ObjectTable* const cacheTable =
            cache
                ? &tables.sharedCacheMemoryObjects.try_emplace(cache->uuid, tables.nodes.get()).first->second
                : nullptr;
        for (TLMemoryRegion& region : process->memoryRegions()) {
            TLMemoryObject& object = tables.objectForRegion(region, *process, cacheTable);
            if (isSample && region.subrangeList) {
                takenSubranges_.emplace_back(&region, copyOf(*region.subrangeList, process->pageSize()));
            }
            object.addRegionForProcess(region, process.get());
            if (asCharged && region.ownedExclusivelyByParentProcess) {
                object.ownerPid = process->pid();
            }
            region.memoryObject = &object;
        }
    }
    tables.finalizeSizes();

    pidToTally_.clear();
    for (const auto& process : displayedProcesses()) {
        pidToTally_[process->pid()] = asCharged ? sumOfRegions(*process) : sumOfDistinctObjects(*process);
    }
}

} // namespace tally
