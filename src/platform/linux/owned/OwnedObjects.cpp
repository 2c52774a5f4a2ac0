#include "platform/linux/owned/OwnedObjects.h"

#include "platform/linux/io/Notes.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/owned/HeldFiles.h"
#include "platform/linux/owned/OwnedGather.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <map>
#include <optional>
#include <string>
#include <unordered_set>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

/// The files in memory that a task maps.
class MappedObjects {
  public:
    MappedObjects(std::span<const Mapping> mappings, const std::string& folder)
        : mappings_(mappings), folder_(folder) {}

    bool contain(std::uint64_t objectId) {
        if (!ids_) {
            ids_.emplace();
            for (const Mapping& mapping : mappings_) {
                if (mapping.isFileBacked() && mapping.deviceMajor == 0) { // no disk's
                    ids_->insert(objectIdOfFile(backingOf(mapping, folder_)));
                }
            }
        }
        return ids_->contains(objectId);
    }

    bool containSysV(std::uint64_t id) const {
        return std::ranges::any_of(mappings_, [id](const Mapping& mapping) {
            return mapping.inode == id && mapping.name.starts_with("/SYSV");
        });
    }

  private:
    std::span<const Mapping> mappings_;
    const std::string& folder_;
    std::optional<std::unordered_set<std::uint64_t>> ids_; // made when first asked
};

void listSegments(MemberIdentity task, const MappedObjects& mapped, OwnedRecords* records) {
    for (const SysVSegment& segment : segmentsCreatedBy(task.pid, task.startTicks)) {
        constexpr std::uint64_t internalMount = 1; // where the kernel keeps segments: device 00:01
        OwnedRecord record;
        record.objectId = objectIdOfFile(
            {.backing = Backing::sharedMemory, .device = internalMount, .inode = segment.id, .isSysV = true});
        record.residentSize = segment.resident;
        record.compressedSize = segment.swapped;
        record.virtualSize = std::max(wholePages(segment.size), segment.resident + segment.swapped);
        if (record.holdsMemory() && !mapped.containSysV(segment.id)) {
            records->emplace(record.objectId, record);
        }
    }
}

/// What is swapped out is an object of its own, as it is where somebody maps it.
void divideSwapped(OwnedRecords* records) {
    OwnedRecords swapped;
    for (auto& [id, record] : *records) {
        if (record.compressedSize != 0) {
            OwnedRecord part = record;
            part.objectId = objectIdOfMarkedPages(id);
            part.virtualSize = part.compressedSize;
            part.residentSize = 0;
            swapped.emplace(part.objectId, part);
            record.virtualSize -= std::min(record.virtualSize, record.compressedSize);
            record.compressedSize = 0;
        }
    }
    std::erase_if(*records, [](const auto& each) { return !each.second.holdsMemory(); });
    records->merge(swapped);
}

} // namespace

std::optional<OwnedRecords> ownedObjectsOf(MemberIdentity task, std::span<const Mapping> mappings,
                                           const std::string& folder) {
    OwnedRecords records;
    MappedObjects mapped(mappings, folder);
    const bool isListed = forEachHeldObject(folder, [&](const OwnedRecord& record) {
        if (!mapped.contain(record.objectId)) {
            records.emplace(record.objectId, record);
        }
    });
    if (!isListed && !isRefusal(errno)) {
        return std::nullopt;
    }
    listSegments(task, mapped, &records);
    std::erase_if(records, [&](const auto& record) { return !claimOwnedObject(record.first, task.pid); });
    divideSwapped(&records);
    return records;
}

} // namespace tally::platform
