#include "vm/OwnedObjects.h"

#include "vm/PhysTallyCollection.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TagNames.h"

#include <cerrno>
#include <string>

namespace tally {

using namespace platform;

std::optional<OwnedVmObjects> gatherOwnedVmObjects(WalkedTask& task) {
    if (!physTallyCollectionEnabled()) {
        return std::nullopt;
    }
    const auto list = sysctl_owned_vmobjects(task.task);
    if (!list) {
        if (errno != ENOENT) {
            task.reportWarning("vm.get_owned_vmobjects");
        }
        return std::nullopt;
    }
    OwnedVmObjects objects;
    objects.reserve(list->size());
    for (const owned_vmobject& object : *list) {
        objects.insert_or_assign(object.id, object);
    }
    return objects;
}

void chargeOwnedObject(TLMemoryRegion& region, const owned_vmobject& object) {
    region.ownedExclusivelyByParentProcess = true;
    region.reclaimableSize = object.reusableSize;
    region.dirtySize = 0;
    region.swappedSize = 0;
    region.cleanNonSpecSize = 0;
    if (object.noTally) {
        return;
    }
    if (object.purgeable == VM_PURGABLE_VOLATILE || object.purgeable == VM_PURGABLE_EMPTY) {
        region.dirtySize = object.wiredSize; // the rest can be taken away at any time
    } else {
        region.dirtySize =
            object.residentSize > object.reusableSize ? object.residentSize - object.reusableSize : 0;
        region.swappedSize = object.compressedSize;
    }
}

Name nameWithLedgerTag(Name tagName, const owned_vmobject& object) {
    const Name ledgerName = nameForLedgerTag(object.ledgerTag);
    if (ledgerName.isNull()) {
        return tagName;
    }
    return Name(std::string(tagName.view()) + " (" + std::string(ledgerName.view()) + ")");
}

TLMemoryRegion unmappedRegionForOwnedObject(const owned_vmobject& object) {
    TLMemoryRegion region;
    chargeOwnedObject(region, object);
    region.user_tag = TLUnmappedTag;
    region.name = nameWithLedgerTag(nameForTag(TLUnmappedTag), object);
    region.object_id = object.id;
    region.start = TLNotSet;
    region.size = object.virtualSize;
    region.share_mode = SM_SHARED;
    region.wired = object.wiredSize != 0;
    return region;
}

} // namespace tally
