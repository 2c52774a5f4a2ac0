// Any bytes as the file of an image: what is made of them holds together, for a process that maps every page
// of the file with every right, and memory behind each.

#include "platform/linux/images/ElfLayout.h"
#include "platform/linux/images/ImageSegments.h"

#include <sys/mman.h>

#include <cstdlib>

using namespace tally::platform;

namespace {

void require(bool holds) {
    if (!holds) {
        std::abort();
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const unsigned char* bytes, std::size_t size) {
    static const Descriptor file(memfd_create("fuzzed", MFD_CLOEXEC));
    require(ftruncate(file.number(), 0) == 0 &&
            pwrite(file.number(), bytes, size, 0) == static_cast<ssize_t>(size));
    const std::optional<ElfLayout> layout = readElfLayout(file);
    std::vector<Mapping> mappings;
    for (std::uint64_t i = 0; layout && i < 64; ++i) {
        Mapping mapping;
        mapping.start = 0x7f0000000000 + i * basePage;
        mapping.end = mapping.start + basePage;
        mapping.fileOffset = i / 4 * basePage;
        mapping.inode = i % 4 == 3 ? 0 : 1;
        mapping.executable = i % 4 == 0;
        mappings.push_back(mapping);
    }
    for (const Mapping& mapping : mappings) {
        if (const auto bias = mapping.executable ? biasOf(*layout, mapping) : std::nullopt) {
            std::uint64_t reached = mappings.front().start;
            for (const RKSegment& segment : segmentsOf(*layout, *bias, mapping, mappings)) {
                require(segment.start >= reached && segment.size != 0);
                reached = segment.start + segment.size;
            }
            require(reached <= mappings.back().end);
        }
    }
    return 0;
}
