// The region and page queries, answered from the walk that is under way.

#include "platform/linux/calls/Task.h"
#include "platform/mach_vm.h"

#include <algorithm>

namespace tally::platform {

namespace {

/// The piece at or above an address, with the walk it belongs to.
struct Found {
    std::shared_ptr<Task> task;
    const Walk* walk = nullptr;
    const Piece* piece = nullptr;
    kern_return_t status = KERN_INVALID_ARGUMENT;
};

Found findPiece(mach_port_t port, std::uint64_t address) {
    Found found;
    found.task = taskOfPort(port);
    if (found.task) {
        found.walk = found.task->walk(&found.status);
    }
    if (found.walk != nullptr) {
        found.piece = found.walk->pieceAt(address);
        found.status = found.piece == nullptr ? found.walk->statusPastEnd() : KERN_SUCCESS;
    }
    return found;
}

} // namespace

kern_return_t mach_vm_region(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                             vm_region_basic_info_64* info) {
    const Found found = findPiece(task, *address);
    if (found.status == KERN_SUCCESS) {
        *address = found.piece->start;
        *size = found.piece->size;
        *info = vm_region_basic_info_64();
        info->protection = found.piece->protection;
        info->max_protection = found.piece->protection;
        info->offset = found.piece->offset;
        info->shared = found.piece->shareMode == SM_SHARED ? 1 : 0;
        info->user_wired_count = found.piece->isWired ? 1 : 0;
    }
    return found.status;
}

kern_return_t mach_vm_region_recurse(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                                     std::uint32_t* depth, vm_region_submap_info_64* info,
                                     std::uint32_t* count) {
    const Found found = findPiece(task, *address);
    if (found.status != KERN_SUCCESS) {
        if (found.task) {
            found.task->endWalk(); // past the end, or broken off: the walk is over
        }
        return found.status;
    }
    const Piece& piece = *found.piece;
    *address = piece.start;
    *size = piece.size;
    *depth = 0; // there are no submaps
    *info = vm_region_submap_info_64();
    info->protection = piece.protection;
    info->max_protection = piece.protection;
    info->offset = piece.offset;
    info->user_tag = piece.tag;
    info->pages_resident = piece.resident;
    info->pages_swapped_out = piece.swapped;
    info->pages_dirtied = piece.dirty;
    info->pages_reusable = piece.reusable;
    info->ref_count = 1;
    info->external_pager = piece.externalPager ? 1 : 0;
    info->share_mode = piece.shareMode;
    info->object_id = static_cast<std::uint32_t>(piece.objectId);
    info->object_id_full = piece.objectId;
    info->user_wired_count = piece.isWired ? 1 : 0;
    *count = VM_REGION_SUBMAP_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t mach_vm_page_range_query(mach_port_t task, std::uint64_t address, std::uint64_t size,
                                       std::span<std::int32_t> dispositions, std::uint64_t* count) {
    const std::shared_ptr<Task> found = taskOfPort(task);
    if (!found) {
        return KERN_INVALID_ARGUMENT;
    }
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = found->walk(&status);
    if (walk == nullptr) {
        return status;
    }
    *count = std::min<std::uint64_t>({size / basePage, dispositions.size(), *count});
    walk->pageWords(address, dispositions.first(*count));
    return KERN_SUCCESS;
}

std::uint64_t mach_vm_next_page(mach_port_t task, std::uint64_t address, std::uint64_t end) {
    const std::shared_ptr<Task> found = taskOfPort(task);
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = found ? found->walk(&status) : nullptr;
    return walk == nullptr ? address : walk->nextPage(address, end);
}

kern_return_t mach_vm_purgable_get_state(mach_port_t /*task*/, std::uint64_t /*address*/, int* state) {
    *state = VM_PURGABLE_DENY; // nothing is purgeable here
    return KERN_SUCCESS;
}

} // namespace tally::platform
