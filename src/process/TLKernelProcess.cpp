#include "process/TLKernelProcess.h"

#include "base/Format.h"
#include "process/KernelSiteNames.h"

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <utility>

namespace tally {

using namespace platform;

namespace {

// Zones and sites are objects of their own: their ids are their numbers with one of these bits.
constexpr std::uint64_t zoneObject = std::uint64_t{1} << 33;
constexpr std::uint64_t siteObject = std::uint64_t{1} << 32;

TLMemoryRegion regionOfZone(const mach_zone_info& zone, const std::string& name, std::size_t index) {
    const std::uint64_t inUse = zone.elements_in_use * zone.element_size;
    const std::string known = kernelName(name);
    TLMemoryRegion region;
    region.name = Name(isUTF8(known) ? known : "unknown");
    region.size = zone.current_size;
    region.dirtySize = zone.collectable == 0 ? zone.current_size : std::min(inUse, zone.current_size);
    region.reclaimableSize = zone.current_size - region.dirtySize;
    region.object_id = zoneObject | index;
    return region;
}

/// Memory of zones, of user processes and of what is hidden counts elsewhere already: it is clean here.
TLMemoryRegion regionOfSite(const mach_memory_site& site, const KernelSiteNames& names, std::size_t index) {
    const bool isHidden = (site.flags & kernelSiteIsHidden) != 0;
    const bool isUserWired = site.site == kernelTagMlock;
    const bool isWired = (site.flags & (kernelSiteIsWired | kernelSiteIsOfZone)) == kernelSiteIsWired;
    TLMemoryRegion region;
    region.name = Name(names.regionName(site));
    region.size = site.size;
    if (isWired && !isHidden && !isUserWired) {
        region.dirtySize = site.size;
    } else {
        region.cleanNonSpecSize = site.size;
        region.detailedName = isHidden ? Name("(hidden)") : isUserWired ? Name("(user wired)") : Name();
    }
    if ((site.flags & kernelSiteTypeMask) == kernelSiteIsCode) {
        if (const auto source = names.sourceOf(site.site)) {
            region.detailedName = Name(*source);
        }
    }
    region.wired = (site.flags & kernelSiteIsWired) != 0;
    region.user_tag = static_cast<std::uint32_t>(index);
    region.object_id = siteObject | index;
    return region;
}

bool isCounter(const mach_memory_site& site) {
    constexpr std::uint64_t mask = kernelSiteTypeMask | kernelSiteIsWired | kernelSiteIsOfZone;
    return (site.flags & mask) == kernelSiteIsCounter;
}

} // namespace

bool TLKernelProcess::initWithBsdInfo(const proc_bsdinfo& info) {
    if (!TLProcess::initWithBsdInfo(info)) {
        return false;
    }
    setIdleExitStatus(TLIdleExitStatus::notTracked);
    return true;
}

void TLKernelProcess::gatherData() {
    if (hasMemoryRegions()) {
        return;
    }
    mach_memory_record record;
    if (const kern_return_t status = mach_memory_info(&record); status != KERN_SUCCESS) {
        const char* const reason = mach_error_string(status);
        std::fprintf(stderr, "%s: mach_memory_info: %s\n", printable(displayString()).c_str(), reason);
        addError(displayString() + ": " + reason);
        return;
    }
    RegionList regions;
    addZones(record, regions);
    addSites(record, regions);
    setMemoryRegions(std::move(regions));
    for (std::string& notice : record.notices) {
        addWarning(std::move(notice));
    }
}

void TLKernelProcess::addZones(const mach_memory_record& record, RegionList& regions) const {
    const std::size_t count = std::min(record.zone_names.size(), record.zones.size());
    for (std::size_t i = 0; i < count; ++i) {
        regions.push_back(regionOfZone(record.zones[i], record.zone_names[i], i));
    }
}

void TLKernelProcess::addSites(const mach_memory_record& record, RegionList& regions) {
    const KernelSiteNames names(record.zone_names);
    for (std::size_t i = 0; i < record.sites.size(); ++i) {
        const mach_memory_site& site = record.sites[i];
        const std::uint64_t value = isCounter(site) ? site.mapped : site.size;
        if (site.site == 0 && value == 0) {
            continue;
        }
        if (isCounter(site)) {
            const TLAuxData counter(static_cast<std::int64_t>(value), /*shouldAggregate=*/false);
            auxData_.entries.insert_or_assign(names.counterName(site), counter);
        } else {
            regions.push_back(regionOfSite(site, names, i));
        }
    }
}

} // namespace tally
