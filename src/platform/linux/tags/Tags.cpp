#include "platform/linux/tags/Tags.h"

#include "platform/linux/tags/AllocatorMemory.h"
#include "platform/linux/tags/NamelessMemory.h"
#include "platform/linux/tags/TagTable.h"
#include "platform/linux/tags/ThreadStacks.h"

#include <algorithm>
#include <cstddef>
#include <string_view>

namespace tally::platform {

namespace {

/// NAME of "[anon:NAME]" or "[anon_shmem:NAME]", which is what the program called its memory; empty
/// otherwise.
std::string_view givenName(std::string_view name) {
    const bool isGiven = name.starts_with("[anon:") || name.starts_with("[anon_shmem:");
    if (!isGiven || !name.ends_with(']')) {
        return {};
    }
    name.remove_suffix(1);
    return name.substr(name.find(':') + 1);
}

std::uint32_t tagOfNamelessFile(const Mapping& mapping, const BackingObject& object) {
    return object.isSysV                             ? tags::sharedSysV
           : mapping.name.starts_with("/memfd:")     ? tags::sharedMemfd
           : object.backing == Backing::hugetlb      ? tags::hugePagePool
           : object.backing == Backing::sharedMemory ? tags::sharedAnonymous
                                                     : tags::untagged;
}

/// What a mapping says of itself.
std::uint32_t tagByItself(const Mapping& mapping, const BackingObject& object, const MappingPages& pages) {
    if (object.backing == Backing::special) {
        return tags::kernelPages;
    }
    if (const std::string_view name = givenName(mapping.name); !name.empty()) {
        return tagOfName(name);
    }
    if (object.backing != Backing::anonymous) {
        return object.hasName ? tags::untagged : tagOfNamelessFile(mapping, object);
    }
    if (mapping.name == "[heap]") {
        return tags::breakHeap;
    }
    if (mapping.name == "[stack]" || mapping.name.starts_with("[stack:")) {
        return tags::stack;
    }
    // What holds memory is no guard, whatever its protection is for the moment.
    return isInaccessible(mapping) && pages.own() == 0 ? tags::guard : tags::untagged;
}

/// Whether the name of a file that is mapped ends in a component that begins with `library`.
bool mapsLibrary(std::span<const Mapping> mappings, std::string_view library) {
    return std::any_of(mappings.begin(), mappings.end(), [&](const Mapping& mapping) {
        const std::string_view name = mapping.name;
        return name.substr(name.rfind('/') + 1).starts_with(library);
    });
}

constexpr std::uint64_t goHeapStart = 0xc000000000;
constexpr std::uint64_t goHeapEnd = 0xc100000000;
constexpr std::uint64_t compressedHeapEnd = std::uint64_t{32} << 30; // above it, references need 8 bytes
constexpr std::uint64_t jemallocAlignment = 256 << 10;

/// The rules that go by where runtimes and allocators are known to put their memory.
class RuntimeRules {
  public:
    explicit RuntimeRules(std::span<const Mapping> mappings)
        : hasJava_(mapsLibrary(mappings, "libjvm.so")),
          hasJemalloc_(mapsLibrary(mappings, "libjemalloc.so")) {
        const auto at =
            std::lower_bound(mappings.begin(), mappings.end(), goHeapStart,
                             [](const Mapping& m, std::uint64_t start) { return m.start < start; });
        hasGo_ = at != mappings.end() && at->start == goHeapStart && isNamelessMemory(*at);
    }

    std::uint32_t tagOf(const Mapping& mapping) const {
        if (mapping.executable) {
            return hasJava_ ? tags::java : tags::generatedCode;
        }
        if (!mapping.writable) {
            return tags::untagged;
        }
        if (hasGo_ && mapping.start >= goHeapStart && mapping.end <= goHeapEnd) {
            return tags::goHeap;
        }
        if (hasJava_ && mapping.end <= compressedHeapEnd) {
            return tags::java;
        }
        return hasJemalloc_ && mapping.start % jemallocAlignment == 0 ? tags::jemalloc : tags::untagged;
    }

  private:
    bool hasJava_;
    bool hasJemalloc_;
    bool hasGo_ = false;
};

} // namespace

std::vector<std::uint32_t> tagsOf(const std::string& folder, std::span<const Mapping> mappings,
                                  std::span<const BackingObject> objects, const PageStates& states) {
    std::vector<std::uint32_t> tags;
    tags.reserve(mappings.size());
    for (std::size_t i = 0; i < mappings.size(); ++i) {
        tags.push_back(tagByItself(mappings[i], objects[i], states.mappings[i]));
    }
    // What the memory itself shows is surer than where it lies, so that comes first.
    tagAllocatorMemory(folder, mappings, states, tags);
    tagThreadStacks(folder, mappings, tags);
    const RuntimeRules rules(mappings);
    for (std::size_t i = 0; i < mappings.size(); ++i) {
        if (tags[i] == tags::untagged && isNamelessMemory(mappings[i])) {
            tags[i] = rules.tagOf(mappings[i]);
        }
    }
    return tags;
}

} // namespace tally::platform
