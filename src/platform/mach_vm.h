// The address space of a task: its mappings, their page counts and the state of single pages.
//
// Addresses and sizes are bytes. Page counts are in pages of vm_kernel_page_size. A walk is not a snapshot:
// the address space can change between two calls. One task is asked by one thread at a time; different tasks
// may be asked at once.

#pragma once

#include "platform/kern_return.h"

#include <cstdint>
#include <span>

namespace tally::platform {

/// What mach_vm_region tells of a mapping.
struct vm_region_basic_info_64 {
    std::int32_t protection = 0;
    std::int32_t max_protection = 0;
    std::uint32_t inheritance = 0;
    std::uint32_t shared = 0;
    std::uint32_t reserved = 0;
    std::uint64_t offset = 0;
    std::int32_t behavior = 0;
    std::uint16_t user_wired_count = 0;
};

/// What mach_vm_region_recurse tells of a mapping. Page counts are as the accounting switch says
/// ("vm.self_region_tally"): as charged to the task, or as the VM object sees them.
struct vm_region_submap_info_64 {
    std::int32_t protection = 0;
    std::int32_t max_protection = 0;
    std::uint32_t inheritance = 0;
    std::uint64_t offset = 0; // of the first byte in its VM object
    std::uint32_t user_tag = 0;
    std::uint32_t pages_resident = 0;
    std::uint32_t pages_shared_now_private = 0;
    std::uint32_t pages_swapped_out = 0;
    std::uint32_t pages_dirtied = 0;
    std::uint32_t ref_count = 0;
    std::uint16_t shadow_depth = 0;
    std::uint8_t external_pager = 0; // 1: backed by a file that has a name
    std::uint8_t share_mode = 0;     // SM_...
    std::uint32_t is_submap = 0;
    std::int32_t behavior = 0;
    std::uint32_t object_id = 0;
    std::uint16_t user_wired_count = 0;
    std::uint32_t pages_reusable = 0;
    std::uint64_t object_id_full = 0; // of the VM object; 0 when there is none
};

/// Counts of 32-bit words that mach_vm_region_recurse reports; a kernel that fills fewer than the full count
/// leaves `object_id_full` out.
inline constexpr std::uint32_t VM_REGION_SUBMAP_INFO_COUNT_64 = 19;
inline constexpr std::uint32_t VM_REGION_SUBMAP_INFO_V1_COUNT_64 = 18;

// Share modes of a mapping.
inline constexpr std::uint8_t SM_COW = 1;
inline constexpr std::uint8_t SM_PRIVATE = 2;
inline constexpr std::uint8_t SM_EMPTY = 3;
inline constexpr std::uint8_t SM_SHARED = 4;
inline constexpr std::uint8_t SM_TRUESHARED = 5;
inline constexpr std::uint8_t SM_PRIVATE_ALIASED = 6;
inline constexpr std::uint8_t SM_SHARED_ALIASED = 7;
inline constexpr std::uint8_t SM_LARGE_PAGE = 8;

// Purgeable states.
inline constexpr int VM_PURGABLE_NONVOLATILE = 0;
inline constexpr int VM_PURGABLE_VOLATILE = 1;
inline constexpr int VM_PURGABLE_EMPTY = 2;
inline constexpr int VM_PURGABLE_DENY = 3; // not purgeable

// Bits of a page's disposition.
inline constexpr std::int32_t VM_PAGE_QUERY_PAGE_PRESENT = 0x1;
inline constexpr std::int32_t VM_PAGE_QUERY_PAGE_DIRTY = 0x8;
inline constexpr std::int32_t VM_PAGE_QUERY_PAGE_PAGED_OUT = 0x10;
inline constexpr std::int32_t VM_PAGE_QUERY_PAGE_EXTERNAL = 0x80;
inline constexpr std::int32_t VM_PAGE_QUERY_PAGE_REUSABLE = 0x800;

/// Finds the first mapping of `task` that ends above `*address`; a shared library cache or another submap is
/// one mapping here.
/// @param address in: where to look; out: the mapping's first byte, page-aligned.
/// @param size    out: its length, a multiple of the page size.
/// @return KERN_SUCCESS; KERN_INVALID_ADDRESS past the last mapping (outputs untouched);
///         KERN_INVALID_ARGUMENT when the task has ended or the port names none; KERN_FAILURE when the
///         mapping's state could not be read.
kern_return_t mach_vm_region(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                             vm_region_basic_info_64* info);

/// As mach_vm_region, but descends into submaps down to `*depth` and tells the page counts.
/// @param depth in: how deep to descend; out: how deep the mapping lies.
/// @param count in: words the caller has room for; out: words filled.
kern_return_t mach_vm_region_recurse(mach_port_t task, std::uint64_t* address, std::uint64_t* size,
                                     std::uint32_t* depth, vm_region_submap_info_64* info,
                                     std::uint32_t* count);

/// One disposition word per page of [address, address + size), which may cover no mapping (all words 0).
/// @param dispositions room for the words; @param count in: its length; out: words filled.
/// @return KERN_SUCCESS; KERN_INVALID_ARGUMENT when the task has ended; KERN_FAILURE when the states could
///         not be read.
kern_return_t mach_vm_page_range_query(mach_port_t task, std::uint64_t address, std::uint64_t size,
                                       std::span<std::int32_t> dispositions, std::uint64_t* count);

/// The first page in [address, end) of which the query above tells anything, that is, whose word is not 0.
/// @return its address; `end` when there is none, `address` when that cannot be told.
std::uint64_t mach_vm_next_page(mach_port_t task, std::uint64_t address, std::uint64_t end);

/// Reads the purgeable state (VM_PURGABLE_...) of the mapping at `address` into `*state`.
/// @return KERN_SUCCESS, or an error, and then the mapping counts as not purgeable.
kern_return_t mach_vm_purgable_get_state(mach_port_t task, std::uint64_t address, int* state);

} // namespace tally::platform
