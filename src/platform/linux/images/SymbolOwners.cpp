#include "platform/linux/images/SymbolOwners.h"

#include "platform/linux/images/ImageSegments.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/objects/ObjectId.h"

#include <algorithm>
#include <map>
#include <utility>

namespace tally::platform {

namespace {

constexpr const char* kernelCode = "[vdso]";

// Loaders make a handful of the same file at most. Somebody who maps one thousands of times shall not hold up
// everybody's measurement.
constexpr int mostInstances = 64;

/// The code of the images made so far: where a range ends, and where it begins.
using CodeRanges = std::map<std::uint64_t, std::uint64_t>;

/// Whether the mapping is in one of them: an image's code can be several mappings.
bool isCovered(const CodeRanges& ranges, const Mapping& mapping) {
    const auto range = ranges.upper_bound(mapping.start);
    return range != ranges.end() && range->second <= mapping.start;
}

} // namespace

std::vector<RKSymbolOwner> symbolOwnersOf(std::span<const Mapping> mappings, const std::string& folder) {
    std::vector<RKSymbolOwner> owners;
    CodeRanges code;
    std::map<std::uint64_t, int> instances; // by object id of the file
    for (const Mapping& mapping : mappings) {
        if (mapping.name == kernelCode) {
            owners.push_back({kernelCode, mapping.start, {{mapping.start, mapping.size(), "__TEXT"}}});
        }
        if (!mapping.executable || !mapping.isFileBacked() || isCovered(code, mapping)) {
            continue;
        }
        // A file in memory is shared memory first of all: its pages are dirty, whoever maps them.
        const BackingObject object = backingOf(mapping, folder);
        if (object.backing != Backing::file || ++instances[objectIdOfFile(object)] > mostInstances) {
            continue;
        }
        const auto layout = layoutOfFile(object, folder, mapping);
        const auto bias = layout ? biasOf(*layout, mapping) : std::nullopt;
        if (!bias) {
            continue;
        }
        owners.push_back({mapping.name, *bias + layout->loads.front().firstPage(),
                          segmentsOf(*layout, *bias, mapping, mappings)});
        for (const RKSegment& segment : owners.back().segments) {
            if (segment.name == "__TEXT") {
                code.emplace(segment.start + segment.size, segment.start);
            }
        }
    }
    return owners;
}

} // namespace tally::platform
