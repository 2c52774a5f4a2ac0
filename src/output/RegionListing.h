// RegionListing: the address space of one process, a line per region, sizes in its pages.

#pragma once

#include "output/ValueFormat.h"
#include "process/TLProcess.h"

#include <cstdio>
#include <span>

namespace tally {

void printRegionListing(std::FILE* output, const ValueFormat& format, const TLProcess& process,
                        std::span<const TLMemoryRegion> regions);

} // namespace tally
