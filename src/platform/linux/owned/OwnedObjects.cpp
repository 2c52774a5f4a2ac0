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

void listSegments(MemberIdentity task, const MappedObjects& mapped, OwnedObjects* records) {
    for (const SysVSegment& segment : segmentsCreatedBy(task.pid, task.startTicks)) {
        constexpr std::uint64_t internalMount = 1; // where the kernel keeps segments: device 00:01
        owned_vmobject record{.purgeable = VM_PURGABLE_DENY};
        record.id = objectIdOfFile(
            {.backing = Backing::sharedMemory, .device = internalMount, .inode = segment.id, .isSysV = true});
        record.residentSize = segment.resident;
        record.compressedSize = segment.swapped;
        record.virtualSize = std::max(wholePages(segment.size), segment.resident + segment.swapped);
        if (record.holdsMemory() && !mapped.containSysV(segment.id)) {
            records->emplace(record.id, record);
        }
    }
}

/// What is swapped out is an object of its own, as it is where somebody maps it.
void divideSwapped(OwnedObjects* records) {
    OwnedObjects swapped;
    for (auto& [id, record] : *records) {
        if (record.compressedSize != 0) {
            owned_vmobject part = record;
            part.id = objectIdOfMarkedPages(id);
            part.virtualSize = part.compressedSize;
            part.residentSize = 0;
            swapped.emplace(part.id, part);
            record.virtualSize -= std::min(record.virtualSize, record.compressedSize);
            record.compressedSize = 0;
        }
    }
    std::erase_if(*records, [](const auto& each) { return !each.second.holdsMemory(); });
    records->merge(swapped);
}

} // namespace

std::optional<OwnedObjects> ownedObjectsOf(MemberIdentity task, std::span<const Mapping> mappings,
                                           const std::string& folder) {
    OwnedObjects records;
    MappedObjects mapped(mappings, folder);
    const bool isListed = forEachHeldObject(folder, [&](const owned_vmobject& record) {
        if (!mapped.contain(record.id)) {
            records.emplace(record.id, record);
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
