// The list of the objects that a task owns without mapping them.

#include "platform/bsd_process.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/owned/HeldFiles.h"
#include "platform/linux/owned/OwnedGather.h"
#include "platform/linux/owned/OwnedRecord.h"
#include "platform/linux/walk/Task.h"

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

using Records = std::map<std::uint64_t, OwnedRecord>; // by object id

/// The files in memory that a task maps.
class MappedObjects {
  public:
    explicit MappedObjects(const Walk& walk) : walk_(walk) {}

    bool contain(std::uint64_t objectId) {
        if (!ids_) {
            ids_.emplace();
            for (const Mapping& mapping : walk_.mappings()) {
                if (mapping.isFileBacked() && mapping.deviceMajor == 0) { // no disk's
                    ids_->insert(objectIdOfFile(backingOf(mapping, walk_.folder())));
                }
            }
        }
        return ids_->contains(objectId);
    }

    bool containSysV(std::uint64_t id) const {
        return std::ranges::any_of(walk_.mappings(), [id](const Mapping& mapping) {
            return mapping.inode == id && mapping.name.starts_with("/SYSV");
        });
    }

  private:
    const Walk& walk_;
    std::optional<std::unordered_set<std::uint64_t>> ids_; // made when first asked
};

void listSegments(const Task& task, const MappedObjects& mapped, Records* records) {
    for (const SysVSegment& segment : segmentsCreatedBy(task.pid(), task.startTicks())) {
        constexpr std::uint64_t internalMount = 1; // where the kernel keeps segments: device 00:01
        OwnedRecord record;
        record.objectId = objectIdOfFile(
            {.backing = Backing::sharedMemory, .device = internalMount, .inode = segment.id, .isSysV = true});
        record.residentSize = segment.resident;
        record.compressedSize = segment.swapped;
        record.virtualSize =
            std::max((segment.size + basePage - 1) / basePage * basePage, segment.resident + segment.swapped);
        if (record.holdsMemory() && !mapped.containSysV(segment.id)) {
            records->emplace(record.objectId, record);
        }
    }
}

/// What is swapped out is an object of its own, as it is where somebody maps it.
void divideSwapped(Records* records) {
    Records swapped;
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

/// @return absent with errno when the list cannot be made.
std::optional<Records> ownedBy(Task& task) {
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task.walk(&status);
    if (walk == nullptr) {
        errno = ENOENT; // nothing is listed; why is for the walk to say
        return std::nullopt;
    }
    Records records;
    MappedObjects mapped(*walk);
    std::vector<std::string> notes;
    const NoteTaker taker(notes);
    const bool isListed = forEachHeldObject(walk->folder(), [&](const OwnedRecord& record) {
        if (!mapped.contain(record.objectId)) {
            records.emplace(record.objectId, record);
        }
    });
    if (!isListed && !isRefusal(errno)) {
        return std::nullopt; // the process has ended
    }
    task.addNotices(std::move(notes));
    listSegments(task, mapped, &records);
    std::erase_if(records, [&](const auto& record) { return !claimOwnedObject(record.first, task.pid()); });
    divideSwapped(&records);
    return records;
}

/// The list that this thread was told the length of last: it is asked for right after.
struct ToldList {
    std::uint32_t task = 0;
    std::vector<std::byte> bytes;
};
ToldList& toldList() {
    thread_local ToldList list;
    return list;
}

std::vector<std::byte> bytesOf(const Records& records) {
    const std::uint64_t count = records.size();
    std::vector<std::byte> bytes(sizeof count + count * sizeof(OwnedRecord));
    std::memcpy(bytes.data(), &count, sizeof count);
    std::byte* at = bytes.data() + sizeof count;
    for (const auto& [id, record] : records) {
        std::memcpy(at, &record, sizeof record);
        at += sizeof record;
    }
    return bytes;
}

} // namespace

int sysctl_owned_vmobjects(std::uint32_t port, std::span<std::byte> reply, std::size_t* length) {
    ToldList list = std::exchange(toldList(), {});
    if (reply.empty() || list.task != port) {
        const std::shared_ptr<Task> task = taskOfPort(port);
        errno = ESRCH;
        const std::optional<Records> records = task ? ownedBy(*task) : std::nullopt;
        if (!records) {
            return -1;
        }
        list = {port, bytesOf(*records)};
    }
    *length = list.bytes.size();
    if (reply.empty()) {
        toldList() = std::move(list);
    } else {
        *length = std::min(*length, reply.size());
        std::memcpy(reply.data(), list.bytes.data(), *length);
    }
    return 0;
}

} // namespace tally::platform
