#include "platform/linux/walk/PagemapEntry.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/walk/Mapping.h"

#include <sys/mman.h>
#include <unistd.h>

namespace tally::platform {

namespace {

/// The frame of the kernel's zero page, learnt from a page of our own that was only read; 0 when frames are
/// hidden.
std::uint64_t zeroFrame() {
    static const std::uint64_t frame = [] {
        void* page = mmap(nullptr, basePage, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
        std::uint64_t entry = 0;
        if (page != MAP_FAILED) {
            static_cast<void>(*static_cast<const volatile char*>(page));
            const Descriptor own = openForReading(systemPath("/proc/self/pagemap"));
            readPagemapEntries(own, reinterpret_cast<std::uintptr_t>(page), std::span(&entry, 1));
            munmap(page, basePage);
        }
        return entry & pagemap::place;
    }();
    return frame;
}

} // namespace

bool framesAreTold() { return zeroFrame() != 0; }

std::size_t readPagemapEntries(const Descriptor& pagemap, std::uint64_t address,
                               std::span<std::uint64_t> entries) {
    const ssize_t bytes = pread(pagemap.number(), entries.data(), entries.size_bytes(),
                                static_cast<off_t>(address / basePage * sizeof(std::uint64_t)));
    return bytes <= 0 ? 0 : static_cast<std::size_t>(bytes) / sizeof(std::uint64_t);
}

std::optional<PageKind> kindOfPagemapEntry(std::uint64_t entry, bool inPrivateAnonymous) {
    if ((entry & pagemap::guard) != 0 || (entry & (pagemap::present | pagemap::swapped)) == 0) {
        return std::nullopt;
    }
    const std::uint64_t frame = entry & pagemap::place;
    const bool isPresent = (entry & pagemap::present) != 0;
    const bool isOfFile = (entry & pagemap::file) != 0;
    if (isPresent && (isOfFile ? inPrivateAnonymous : frame != 0 && frame == zeroFrame())) {
        return std::nullopt; // the huge zero page shows as a file's, the ordinary one by its frame
    }
    return isOfFile ? PageKind::object : isPresent ? PageKind::anonymous : PageKind::swapped;
}

} // namespace tally::platform
