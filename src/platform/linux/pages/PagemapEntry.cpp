#include "platform/linux/pages/PagemapEntry.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/Mapping.h"

#include <sys/mman.h>
#include <unistd.h>

namespace tally::platform {

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

std::size_t readPagemapEntries(const Descriptor& pagemap, std::uint64_t address,
                               std::span<std::uint64_t> entries) {
    const ssize_t bytes = pread(pagemap.number(), entries.data(), entries.size_bytes(),
                                static_cast<off_t>(address / basePage * sizeof(std::uint64_t)));
    return bytes <= 0 ? 0 : static_cast<std::size_t>(bytes) / sizeof(std::uint64_t);
}

} // namespace tally::platform
