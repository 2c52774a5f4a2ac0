#include "vm/TagNames.h"

#include "base/Format.h"
#include "platform/quarry.h"
#include "vm/TLMemoryRegion.h"

#include <array>

namespace tally {

using namespace platform;

namespace {

constexpr std::uint32_t firstAppSpecificTag = 240;
constexpr std::uint32_t tagCount = 256;

struct TagName {
    std::uint32_t tag;
    const char* name;
};

constexpr TagName tagNames[] = {
    {0, "untagged (\"VM_ALLOCATE\")"},
    {1, "malloc metadata"},
    {2, "MALLOC_SMALL"},
    {3, "MALLOC_LARGE"},
    {4, "MALLOC_HUGE"},
    {5, "sbrk"},
    {6, "realloc"},
    {7, "MALLOC_TINY"},
    {8, "MALLOC_LARGE_REUSABLE"},
    {9, "MALLOC_LARGE_REUSED"},
    {10, "performance tool data"},
    {11, "MALLOC_NANO"},
    {18, "system/kernel diagnostics"},
    {20, "Mach message"},
    {21, "driver framework"},
    {30, "stack"},
    {31, "guard"},
    {32, "shared pmap"},
    {33, "dylib"},
    {34, "Objective-C dispatching code"},
    {35, "unshared pmap"},
    {40, "desktop toolkit"},
    {41, "desktop toolkit data"},
    {42, "graphics drawing"},
    {43, "networking framework"},
    {44, "Java"},
    {45, "object persistence"},
    {46, "object persistence cache"},
    {50, "fonts"},
    {51, "animation"},
    {52, "graphics"},
    {53, "graphics server"},
    {54, "graphics devices"},
    {55, "graphics acceleration"},
    {56, "graphics mapping"},
    {57, "graphics effects"},
    {58, "web engine"},
    {60, "dyld private memory"},
    {61, "dyld malloc memory"},
    {62, "SQLite page cache"},
    {63, "WebAssembly"},
    {64, "JS JIT generated code"},
    {65, "JS VM register file"},
    {66, "OpenGL Shading Language"},
    {67, "OpenCL"},
    {68, "image scaling"},
    {69, "image decoding"},
    {70, "font rendering"},
    {71, "media"},
    {72, "media playback"},
    {73, "user-interface assets"},
    {74, "networking"},
    {75, "system logging"},
    {76, "thumbnails"},
    {77, "accounts"},
    {78, "web engine scripts"},
    {79, "web engine objects"},
    {80, "corpse info"},
    {81, "system log data"},
    {82, "Swift runtime"},
    {83, "Swift metadata"},
    {84, "graphics data"},
    {86, "graphics scenes"},
    {87, "graphics surfaces"},
    {88, "media captions"},
    {89, "media codecs"},
    {90, "audio"},
    {91, "video bitstream"},
    {92, "media decoding"},
    {93, "media processing"},
    {94, "media capture"},
    {95, "image analysis"},
    {96, "networking buffers"},
    {97, "user-interface framework"},
    {98, "font cache"},
};

/// The tags that the tool names itself; the other slots are absent.
std::array<Name, tagCount> makeNamedTags() {
    std::array<Name, tagCount> names;
    for (const TagName& row : tagNames) {
        names[row.tag] = Name(row.name);
    }
    for (std::uint32_t tag = firstAppSpecificTag; tag < tagCount; ++tag) {
        names[tag] = Name(formatted("app-specific tag %u", tag - firstAppSpecificTag + 1));
    }
    return names;
}

} // namespace

Name nameForTag(std::uint32_t tag) {
    static const std::array<Name, tagCount> names = makeNamedTags();
    static const Name unmapped("Owned physical tally (unmapped)");
    if (tag == TLUnmappedTag) {
        return unmapped;
    }
    if (tag < tagCount) {
        if (!names[tag].isNull()) {
            return names[tag];
        }
        const auto description = QRYRegionTypeDescriptionForTag(tag);
        if (description && !description->starts_with("Memory Tag")) {
            return Name(*description);
        }
    }
    return Name(formatted("tag %d", static_cast<std::int32_t>(tag)));
}

Name nameForLedgerTag(std::uint64_t ledgerTag) {
    static const std::array<Name, 6> names = {Name(),        Name(),           Name("network"),
                                              Name("media"), Name("graphics"), Name("neural")};
    return ledgerTag < names.size()
               ? names[ledgerTag]
               : Name(formatted("VM ledger tag %llu", static_cast<unsigned long long>(ledgerTag)));
}

} // namespace tally
