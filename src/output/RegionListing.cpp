// RegionListing: pseudo-regions, which are not mapped, have no addresses to show.

#include "output/RegionListing.h"

#include "base/BatchEnumeration.h"
#include "base/Format.h"

namespace tally {

namespace {

using Word = unsigned long long; // what %llu and %llx take

// The low bits of an object id that the listing has room for.
constexpr std::uint64_t shownObjectIdBits = 0xffffffffff;

void printRegion(std::FILE* output, const ValueFormat& format, const TLMemoryRegion& region,
                 std::uint64_t pageSize) {
    const Word objectId = region.object_id & shownObjectIdBits;
    if (region.start == TLNotSet) {
        std::fprintf(output, "        unmapped -         unmapped [%10llx]", objectId);
    } else {
        std::fprintf(output, "%16llx - %16llx [%10llx]", Word{region.start}, Word{region.end()}, objectId);
    }
    const auto printPages = [&](std::uint64_t bytes) {
        std::fprintf(output, " %7llu", Word{pageCount(bytes, pageSize)});
    };
    printPages(region.size);
    printPages(region.chargedSize());
    if (format.shows(TLTextOptionSwapped)) {
        printPages(region.swappedSize);
    }
    printPages(region.cleanNonSpecSize);
    printPages(region.reclaimableSize);
    if (format.shows(TLTextOptionWired)) {
        printPages(region.wired ? region.size : 0);
    }
    std::fprintf(output, "   %s\n", format.displayName(region.name.view(), region.detailedName).c_str());
}

} // namespace

void printRegionListing(std::FILE* output, const ValueFormat& format, const TLProcess& process,
                        std::span<const TLMemoryRegion> regions) {
    const bool swapped = format.shows(TLTextOptionSwapped);
    const bool wired = format.shows(TLTextOptionWired);
    std::fprintf(output, "%s\n\n", printable(process.displayString()).c_str());
    std::fprintf(output,
                 "           start                end  [objectid]      VRT     DRT%s     CLN     RCL%s   tag "
                 "(detail)\n",
                 swapped ? "     SWP" : "", wired ? "    WIRE" : "");
    std::fprintf(output,
                 "      ----------         ----------  ----------    -----   -----%s   -----   -----%s   "
                 "------------\n",
                 swapped ? "   -----" : "", wired ? "   -----" : "");
    tl_enumerateObjectsWithBatchSize(regions, 128, [&](std::span<const TLMemoryRegion> batch) {
        for (const TLMemoryRegion& region : batch) {
            printRegion(output, format, region, process.pageSize());
        }
    });
    std::fputc('\n', output);
}

} // namespace tally
