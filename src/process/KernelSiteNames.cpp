#include "process/KernelSiteNames.h"

#include "base/Format.h"

#include <cinttypes>
#include <iterator>

namespace tally {

using namespace platform;

namespace {

constexpr std::size_t nameFieldSize = 80;
constexpr std::uint64_t anyTag = 255;

constexpr const char* tagNames[] = {
    "NONE",
    "OSFMK",
    "BSD",
    "IOKIT",
    "LIBKERN",
    "OSKEXT",
    "KEXT",
    "IPC",
    "STACK",
    "CPU",
    "PMAP",
    "PTE",
    "ZONE",
    "KALLOC",
    "COMPRESSOR",
    "COMPRESSED_DATA",
    "PHANTOM_CACHE",
    "WAITQ",
    "DIAG",
    "LOG",
    "FILE",
    "MBUF",
    "UBC",
    "SECURITY",
    "MLOCK",
    "REASON",
    "SKYWALK",
    "LTABLE",
    "HV",
    "KALLOC_DATA",
    "RETIRED",
    "KALLOC_TYPE",
    "TRIAGE",
    "FIRST_DYNAMIC",
};
constexpr const char* counterNames[] = {
    "MANAGED",
    "RESERVED",
    "WIRED",
    "WIRED_MANAGED",
    "STOLEN",
    "LOPAGE",
    "MAP_KERNEL",
    "MAP_ZONE",
    "MAP_KALLOC",
    "WIRED_BOOT",
    "BOOT_STOLEN",
    "WIRED_STATIC_KERNELCACHE",
    "MAP_KALLOC_LARGE_DATA",
    "MAP_KERNEL_DATA",
};

std::string tagName(std::uint64_t tag) {
    const std::string prefix = "VM_KERN_MEMORY_";
    return prefix + (tag < std::size(tagNames) ? tagNames[tag] : tag == anyTag ? "ANY" : std::to_string(tag));
}

std::string nameOfCounter(std::uint64_t counter) {
    const std::string prefix = "VM_KERN_COUNT_";
    return prefix + (counter < std::size(counterNames) ? counterNames[counter] : std::to_string(counter));
}

/// Whether a name of the kernel is one: a text with characters.
bool isReadable(const std::string& name) { return !name.empty() && isUTF8(name); }

} // namespace

std::string kernelName(const std::string& name) { return name.substr(0, nameFieldSize).c_str(); }

KernelSiteNames::KernelSiteNames(std::span<const std::string> zoneNames)
    : zoneNames_(zoneNames), modules_(copyLoadedModuleIdentifiers()),
      symbolicator_(RKCreateKernelSymbolicator()) {}

std::string KernelSiteNames::regionName(const mach_memory_site& site) const {
    std::string name = counterName(site);
    if ((site.flags & kernelSiteIsOfZone) != 0 && site.zone < zoneNames_.size()) {
        name += "[" + kernelName(zoneNames_[site.zone]) + "]";
    }
    return name;
}

std::string KernelSiteNames::counterName(const mach_memory_site& site) const {
    if ((site.flags & kernelSiteIsNamed) != 0) {
        if (std::string name = kernelName(site.name); isReadable(name)) {
            return name;
        }
    }
    return typeName(site.flags & kernelSiteTypeMask, site.site);
}

std::string KernelSiteNames::typeName(std::uint64_t type, std::uint64_t site) const {
    switch (type) {
    case kernelSiteIsTag:
        return tagName(site);
    case kernelSiteIsModule: {
        const auto module = modules_.find(site);
        return module != modules_.end() && isReadable(module->second)
                   ? module->second
                   : formatted("unloaded kmod %" PRIu64, site);
    }
    case kernelSiteIsCode: {
        const auto symbol = site != 0 && symbolicator_ ? symbolicator_->symbolName(site) : std::nullopt;
        return symbol && isReadable(*symbol) ? *symbol : formatted("site 0x%" PRIx64, site);
    }
    case kernelSiteIsCounter:
        return nameOfCounter(site);
    default:
        return formatted("unknown site (0x%x, 0x%" PRIx64 ")", static_cast<unsigned>(type), site);
    }
}

std::optional<std::string> KernelSiteNames::sourceOf(std::uint64_t address) const {
    const auto source = symbolicator_ ? symbolicator_->sourceInfo(address) : std::nullopt;
    return source ? std::optional(formatted("(%s:%d)", source->path.c_str(), source->line)) : std::nullopt;
}

} // namespace tally
