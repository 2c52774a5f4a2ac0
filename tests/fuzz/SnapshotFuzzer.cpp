// Any bytes as a snapshot file: they are refused with a reason, or the snapshot holds together.

#include "platform/common/SnapshotText.h"
#include "platform/quarry.h"

#include <cstdlib>

using namespace tally::platform;

namespace {

void require(bool holds) {
    if (!holds) {
        std::abort();
    }
}

} // namespace

namespace tally::platform {

std::uint32_t QRYTagForRegionTypeDescription(std::string_view description) {
    return description.empty() ? 0 : 100;
}

} // namespace tally::platform

extern "C" int LLVMFuzzerTestOneInput(const unsigned char* bytes, std::size_t size) {
    const std::string contents(reinterpret_cast<const char*>(bytes), size);
    require(nameOfSnapshotText(snapshotTextOfName(contents)) == contents);
    std::string error;
    const auto graph = QRYDirectedGraphWithData(contents, &error);
    require((graph == nullptr) != error.empty());
    if (!graph) {
        return 0;
    }
    require(graph->vmPageSize() >= 512 && (graph->vmPageSize() & (graph->vmPageSize() - 1)) == 0 &&
            graph->pid() >= 0);
    const auto cache = QRYArchitectureOf(graph->processDescriptionString(), graph->binaryImagesDescription());
    std::uint64_t end = 0;
    graph->enumerateRegions([&](const QRYVMRegion& region) {
        require(region.address >= end && region.length != 0);
        end = region.address + region.length;
        require(!cache || end <= cache->cacheBase || region.address >= cache->cacheBase + cache->cacheSize);
        require(region.resident_size + region.swapped_out_size <= region.length);
        require(region.dirty_size + region.reusable_size <= region.resident_size);
        require(region.share_mode <= 8 && region.purgeable <= 3);
        return false;
    });
    return 0;
}
