#include "vm/OwnedObjects.h"

#include "base/Assertion.h"
#include "base/Format.h"
#include "platform/bsd_process.h"
#include "vm/PhysTallyCollection.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TagNames.h"
#include "vm/WalkedTask.h"

#include <cerrno>
#include <cstring>
#include <span>

namespace tally {

using namespace platform;

namespace {

constexpr std::size_t SpareSize = 16 * sizeof(OwnedVmObject); // the list may grow between two calls

/// The kernel's complete reply; absent when it gives none.
std::optional<std::vector<std::byte>> ownedObjectsReply(WalkedTask& task) {
    std::size_t length = 0;
    if (sysctl_owned_vmobjects(task.task(), {}, &length) != 0) {
        if (errno != ENOENT) {
            task.reportWarning("vm.get_owned_vmobjects");
        }
        return std::nullopt;
    }
    if (length == 0) {
        return std::vector<std::byte>();
    }
    std::vector<std::byte> reply(length);
    do {
        reply.resize(reply.size() + SpareSize);
        if (sysctl_owned_vmobjects(task.task(), reply, &length) != 0) {
            task.reportWarning("vm.get_owned_vmobjects");
            return std::nullopt;
        }
    } while (length == reply.size());
    reply.resize(length);
    return reply;
}

OwnedVmObjects ownedObjectsOfReply(std::span<const std::byte> reply) {
    OwnedVmObjects objects;
    if (reply.empty()) {
        return objects;
    }
    std::uint64_t count = 0;
    tl_assert(reply.size() >= sizeof count, "length >= sizeof(count)");
    std::memcpy(&count, reply.data(), sizeof count);
    reply = reply.subspan(sizeof count);
    tl_assert(count <= reply.size() / sizeof(OwnedVmObject), "length >= count * sizeof(record)");
    objects.reserve(count);
    for (; count != 0; --count) {
        OwnedVmObject object;
        std::memcpy(&object, reply.data(), sizeof object);
        objects.insert_or_assign(object.objectId, object);
        reply = reply.subspan(sizeof object);
    }
    return objects;
}

} // namespace

std::optional<OwnedVmObjects> gatherOwnedVmObjects(WalkedTask& task) {
    if (!physTallyCollectionEnabled()) {
        return std::nullopt;
    }
    const auto reply = ownedObjectsReply(task);
    return reply ? std::optional(ownedObjectsOfReply(*reply)) : std::nullopt;
}

void chargeOwnedObject(TLMemoryRegion& region, const OwnedVmObject& object) {
    region.ownedExclusivelyByParentProcess = true;
    region.reclaimableSize = object.reusableSize;
    region.dirtySize = 0;
    region.swappedSize = 0;
    region.cleanNonSpecSize = 0;
    if (object.isNotCharged()) {
        return;
    }
    const int state = object.purgeState();
    if (state == VM_PURGABLE_VOLATILE || state == VM_PURGABLE_EMPTY) {
        region.dirtySize = object.wiredSize; // the rest can be taken away at any time
    } else {
        region.dirtySize =
            object.residentSize > object.reusableSize ? object.residentSize - object.reusableSize : 0;
        region.swappedSize = object.compressedSize;
    }
}

Name nameWithLedgerTag(Name tagName, const OwnedVmObject& object) {
    const Name ledgerName = nameForLedgerTag(object.ledgerTag());
    if (ledgerName.isNull()) {
        return tagName;
    }
    return Name(std::string(tagName.view()) + " (" + std::string(ledgerName.view()) + ")");
}

TLMemoryRegion unmappedRegionForOwnedObject(const OwnedVmObject& object) {
    TLMemoryRegion region;
    chargeOwnedObject(region, object);
    region.user_tag = TLUnmappedTag;
    region.name = nameWithLedgerTag(nameForTag(TLUnmappedTag), object);
    region.object_id = object.objectId;
    region.start = TLNotSet;
    region.size = object.virtualSize;
    region.share_mode = SM_SHARED;
    region.wired = object.wiredSize != 0;
    return region;
}

} // namespace tally
