// What the kernel tells of its own memory: zones, wired sites, counters, loaded modules.

#pragma once

#include "platform/kern_return.h"

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace tally::platform {

/// Usage of one zone of the kernel's allocator; sizes in bytes.
struct mach_zone_info {
    std::uint64_t elements_in_use = 0;
    std::uint64_t current_size = 0;
    std::uint64_t element_size = 0;
    std::uint64_t collectable = 0; // non-zero: the zone can give memory back
};

// The low 8 bits of a site's flags are its type.
inline constexpr std::uint64_t kernelSiteTypeMask = 0xff;
inline constexpr std::uint64_t kernelSiteIsTag = 0;
inline constexpr std::uint64_t kernelSiteIsModule = 1;
inline constexpr std::uint64_t kernelSiteIsCode = 2;
inline constexpr std::uint64_t kernelSiteIsCounter = 3;
inline constexpr std::uint64_t kernelSiteIsWired = 0x100;
inline constexpr std::uint64_t kernelSiteIsHidden = 0x200;
inline constexpr std::uint64_t kernelSiteIsNamed = 0x400;
inline constexpr std::uint64_t kernelSiteIsOfZone = 0x800;

inline constexpr std::uint64_t kernelTagMlock = 24; // memory that is wired on behalf of user processes

/// One accounting site of the kernel.
struct mach_memory_site {
    std::uint64_t flags = 0; // kernelSiteIs...
    std::uint64_t site = 0;
    std::uint64_t size = 0;   // bytes
    std::uint64_t mapped = 0; // bytes
    std::uint16_t zone = 0;
    std::string name{};
};

struct mach_memory_record {
    std::vector<std::string> zone_names;
    std::vector<mach_zone_info> zones;
    std::vector<mach_memory_site> sites;
    std::vector<std::string> notices; // texts for the kernel's warnings: what could not be read
};

/// Reads the whole record. @return KERN_SUCCESS, or an error, and then `*record` is empty.
kern_return_t mach_memory_info(mach_memory_record* record);

/// Identifiers of the loaded kernel modules by their load tag; empty where there are none.
std::map<std::uint64_t, std::string> copyLoadedModuleIdentifiers();

} // namespace tally::platform
