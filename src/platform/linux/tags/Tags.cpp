#include "platform/linux/tags/Tags.h"

#include "platform/quarry.h"

#include <array>
#include <optional>
#include <string>

namespace tally::platform {

namespace {

constexpr std::uint32_t untagged = 0;
constexpr std::uint32_t breakHeap = 5;
constexpr std::uint32_t stack = 30;
constexpr std::uint32_t guard = 31;

// Slots that the table of tags leaves free, for memory that only this system has.
struct OwnTag {
    std::uint32_t tag;
    const char* description;
};
constexpr OwnTag sharedAnonymous{100, "shared memory (anonymous)"};
constexpr OwnTag sharedMemfd{101, "shared memory (memfd)"};
constexpr OwnTag sharedSysV{102, "shared memory (SysV)"};
constexpr OwnTag hugePagePool{103, "huge page pool"};
constexpr OwnTag kernelPages{104, "kernel pages for user code"};

std::uint32_t tagOfNamelessFile(const Mapping& mapping, const BackingObject& object) {
    return object.isSysV                             ? sharedSysV.tag
           : mapping.name.starts_with("/memfd:")     ? sharedMemfd.tag
           : object.backing == Backing::hugetlb      ? hugePagePool.tag
           : object.backing == Backing::sharedMemory ? sharedAnonymous.tag
                                                     : untagged;
}

std::uint32_t tagOf(const Mapping& mapping, const BackingObject& object) {
    if (object.backing == Backing::special) {
        return kernelPages.tag;
    }
    if (object.backing != Backing::anonymous) {
        return object.hasName ? untagged : tagOfNamelessFile(mapping, object);
    }
    if (mapping.name == "[heap]") {
        return breakHeap;
    }
    if (mapping.name == "[stack]") {
        return stack;
    }
    return mapping.readable || mapping.writable || mapping.executable ? untagged : guard;
}

} // namespace

std::vector<std::uint32_t> tagsOf(const std::string& /*folder*/, std::span<const Mapping> mappings,
                                  std::span<const BackingObject> objects, const PageStates& /*states*/) {
    std::vector<std::uint32_t> tags;
    tags.reserve(mappings.size());
    for (std::size_t i = 0; i < mappings.size(); ++i) {
        tags.push_back(tagOf(mappings[i], objects[i]));
    }
    return tags;
}

std::optional<std::string> QRYRegionTypeDescriptionForTag(std::uint32_t tag) {
    for (const OwnTag& own : {sharedAnonymous, sharedMemfd, sharedSysV, hugePagePool, kernelPages}) {
        if (own.tag == tag) {
            return own.description;
        }
    }
    return "Memory Tag " + std::to_string(tag);
}

} // namespace tally::platform
