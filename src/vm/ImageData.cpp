#include "vm/ImageData.h"

#include "platform/runekit.h"

#include <algorithm>
#include <functional>
#include <unordered_set>

namespace tally {

using namespace platform;

namespace {

/// The name under which a segment is shown: what its library calls it, without the addition after a blank.
Name displayNameOfSegment(std::string_view rawName) {
    if (rawName == "MACH_HEADER") {
        return Name("__TEXT");
    }
    const std::string_view word = rawName.substr(0, rawName.find(' '));
    return Name(word.empty() ? "unknown" : word);
}

} // namespace

void gatherImageData(WalkedTask& task) {
    static const Name sharedLinkedit("dyld shared cache");
    const TLSharedCache* const cache = task.sharedCache.get();
    std::unordered_set<std::uint64_t> linkeditStarts;
    auto& images = task.images;
    RKForeachSymbolOwner(task.task, [&](const RKSymbolOwner& owner) {
        const bool isInCache = cache != nullptr && cache->contains(owner.base_address);
        const Name ownerPath(isInCache ? owner.path : RKResolvedPath(task.task, owner.path));
        for (const RKSegment& segment : owner.segments) {
            TLImage image;
            image.start = segment.start;
            image.size = segment.size;
            image.ownerPath = ownerPath;
            image.setName(displayNameOfSegment(segment.name));
            if (isInCache && image.segment == TLSegmentKind::linkedit) { // all of the cache's images have one
                if (!linkeditStarts.insert(segment.start).second) {
                    continue;
                }
                image.ownerPath = sharedLinkedit;
            }
            images.push_back(image);
        }
    });
    std::ranges::stable_sort(images, std::less(), &TLImage::start);
}

} // namespace tally
