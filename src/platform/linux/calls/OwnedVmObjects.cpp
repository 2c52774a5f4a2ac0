// The list of the objects that a task owns without mapping them, as a call gives it.

#include "platform/bsd_process.h"

#include "platform/linux/calls/Task.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/owned/OwnedObjects.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <optional>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

/// @return absent with errno when the list cannot be made.
std::optional<OwnedRecords> ownedBy(Task& task) {
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task.walk(&status);
    if (walk == nullptr) {
        errno = ENOENT; // nothing is listed; why is for the walk to say
        return std::nullopt;
    }
    std::vector<std::string> notes;
    std::optional<OwnedRecords> records;
    {
        const NoteTaker taker(notes);
        records = ownedObjectsOf(task.identity(), walk->mappings(), walk->folder());
    }
    if (records) {
        task.addNotices(std::move(notes));
    }
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

std::vector<std::byte> bytesOf(const OwnedRecords& records) {
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
        const std::optional<OwnedRecords> records = task ? ownedBy(*task) : std::nullopt;
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
