// The address space of a task, from its mappings.

#include "platform/mach_vm.h"
#include "platform/scripted/Answer.h"

#include <algorithm>
#include <limits>

namespace tally::platform {

kern_return_t mach_vm_region(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                             vm_region_basic_info_64* info) {
    const Answer answer("mach_vm_region", PortName{task}, {*address});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    const ScriptedMapping* mapping = scripted->findMapping(*address, 0).mapping;
    if (mapping == nullptr) {
        return KERN_INVALID_ADDRESS;
    }
    *address = *mapping->start;
    *size = mapping->size;
    *info = {.protection = mapping->protection,
             .max_protection = mapping->maxProtection,
             .inheritance = mapping->inheritance,
             .shared = mapping->shareMode == SM_SHARED || mapping->shareMode == SM_TRUESHARED,
             .reserved = !mapping->nested.empty(), // tells a submap
             .offset = mapping->offset,
             .behavior = mapping->behavior,
             .user_wired_count = mapping->wiredCount};
    return KERN_SUCCESS;
}

kern_return_t mach_vm_region_recurse(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                                     std::uint32_t* depth, vm_region_submap_info_64* info,
                                     std::uint32_t* count) {
    const Answer answer("mach_vm_region_recurse", PortName{task}, {*address, *depth, *count});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    const auto [mapping, level] = scripted->findMapping(*address, *depth);
    if (mapping == nullptr) {
        return KERN_INVALID_ADDRESS;
    }
    const PageCounts counts = pageCounts(*mapping, answer.view());
    const std::uint64_t fullId = mapping->object.value_or(0);
    *address = *mapping->start;
    *size = mapping->size;
    *depth = level;
    *count = std::min(*count, answer.kernel.submapInfoCount);
    *info = {.protection = mapping->protection,
             .max_protection = mapping->maxProtection,
             .inheritance = mapping->inheritance,
             .offset = mapping->offset,
             .user_tag = mapping->tag,
             .pages_resident = counts.resident,
             .pages_shared_now_private = counts.sharedNowPrivate,
             .pages_swapped_out = counts.swapped,
             .pages_dirtied = counts.dirtied,
             .ref_count = mapping->refCount,
             .shadow_depth = mapping->shadowDepth,
             .external_pager = mapping->hasExternalPager(),
             .share_mode = mapping->shareMode.value_or(SM_PRIVATE),
             .is_submap = !mapping->nested.empty(),
             .behavior = mapping->behavior,
             .object_id = static_cast<std::uint32_t>(fullId),
             .user_wired_count = mapping->wiredCount,
             .pages_reusable = counts.reusable,
             .object_id_full = *count >= VM_REGION_SUBMAP_INFO_COUNT_64 ? fullId : info->object_id_full};
    return KERN_SUCCESS;
}

kern_return_t mach_vm_page_range_query(mach_port_t task, std::uint64_t address, std::uint64_t size,
                                       std::span<std::int32_t> dispositions, std::uint64_t* count) {
    const Answer answer("mach_vm_page_range_query", PortName{task}, {address, size});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    const std::uint64_t pageSize = answer.kernel.pageSize;
    const std::uint64_t pages = std::min<std::uint64_t>(size / pageSize, dispositions.size());
    const ScriptedMapping* mapping = nullptr;
    for (std::uint64_t page = 0; page < pages; ++page) {
        const std::uint64_t at = address + page * pageSize;
        if (mapping == nullptr || at >= mapping->end()) {
            mapping = scripted->findMapping(at, std::numeric_limits<std::uint32_t>::max()).mapping;
        }
        const bool isMapped = mapping != nullptr && at >= *mapping->start;
        dispositions[page] =
            isMapped ? pageWord(*mapping, answer.view(), (at - *mapping->start) / pageSize) : 0;
    }
    *count = pages;
    return KERN_SUCCESS;
}

std::uint64_t mach_vm_next_page(mach_port_t task, std::uint64_t address, std::uint64_t end) {
    const Answer answer("mach_vm_next_page", PortName{task}, {address, end});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return address;
    }
    while (address < end) {
        const ScriptedMapping* mapping =
            scripted->findMapping(address, std::numeric_limits<std::uint32_t>::max()).mapping;
        if (mapping == nullptr) {
            break;
        }
        address = std::max(address, *mapping->start);
        for (; address < std::min(end, mapping->end()); address += answer.kernel.pageSize) {
            if (pageWord(*mapping, answer.view(), (address - *mapping->start) / answer.kernel.pageSize) !=
                0) {
                return address;
            }
        }
    }
    return end;
}

kern_return_t mach_vm_purgable_get_state(mach_port_t task, std::uint64_t address, int* state) {
    const Answer answer("mach_vm_purgable_get_state", PortName{task}, {address});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    const ScriptedMapping* mapping =
        scripted->findMapping(address, std::numeric_limits<std::uint32_t>::max()).mapping;
    if (mapping == nullptr || address < *mapping->start) {
        return KERN_INVALID_ADDRESS;
    }
    if (mapping->purgeableStatus == KERN_SUCCESS) {
        *state = mapping->purgeable;
    }
    return mapping->purgeableStatus;
}

} // namespace tally::platform
