#include "platform/linux/images/ElfLayout.h"

#include "platform/linux/walk/Mapping.h"

#include <gelf.h>
#include <libelf.h>

#include <algorithm>
#include <cstddef>
#include <limits>
#include <memory>

namespace tally::platform {

namespace {

constexpr std::size_t mostHeaders = 4096; // linkers make a dozen; a damaged file can claim billions

std::uint64_t pageBelow(std::uint64_t address) { return address & ~(basePage - 1); }
std::uint64_t pageAbove(std::uint64_t address) { return pageBelow(address + basePage - 1); }

/// Whether a segment can be mapped at all: no end beyond the last page, and address and offset alike within
/// a page.
bool isMappable(const LoadSegment& load) {
    constexpr std::uint64_t most = std::numeric_limits<std::uint64_t>::max() - 2 * basePage;
    return load.memorySize <= most && load.address <= most - load.memorySize &&
           load.fileOffset <= most - load.fileSize && load.fileSize <= load.memorySize &&
           (load.fileSize == 0 || (load.address - load.fileOffset) % basePage == 0);
}

bool areApart(const std::vector<LoadSegment>& loads) {
    return std::adjacent_find(loads.begin(), loads.end(), [](const LoadSegment& a, const LoadSegment& b) {
               return b.address < a.address + a.memorySize;
           }) == loads.end();
}

} // namespace

std::uint64_t LoadSegment::firstPage() const { return pageBelow(address); }
std::uint64_t LoadSegment::endOfFilePages() const {
    return fileSize == 0 ? firstPage() : pageAbove(address + fileSize);
}
std::uint64_t LoadSegment::endPage() const { return pageAbove(address + memorySize); }

std::optional<ElfLayout> readElfLayout(const Descriptor& file) {
    static const bool isReady = elf_version(EV_CURRENT) != EV_NONE;
    const std::unique_ptr<Elf, int (*)(Elf*)> elf(
        isReady ? elf_begin(file.number(), ELF_C_READ, nullptr) : nullptr, elf_end);
    std::size_t count = 0;
    if (!elf || elf_kind(elf.get()) != ELF_K_ELF || elf_getphdrnum(elf.get(), &count) != 0 ||
        count > mostHeaders) {
        return std::nullopt;
    }
    ElfLayout layout;
    for (std::size_t i = 0; i < count; ++i) {
        GElf_Phdr header;
        if (gelf_getphdr(elf.get(), static_cast<int>(i), &header) == nullptr) {
            return std::nullopt;
        }
        if (header.p_type == PT_LOAD && header.p_memsz != 0) {
            layout.loads.push_back({.address = header.p_vaddr,
                                    .memorySize = header.p_memsz,
                                    .fileOffset = header.p_offset,
                                    .fileSize = header.p_filesz,
                                    .writable = (header.p_flags & PF_W) != 0,
                                    .executable = (header.p_flags & PF_X) != 0});
            if (!isMappable(layout.loads.back())) {
                return std::nullopt;
            }
        } else if (header.p_type == PT_GNU_RELRO) {
            // As loaders do it: a page that ends behind the range stays writable.
            layout.relroStart = pageBelow(header.p_vaddr);
            layout.relroEnd = pageBelow(header.p_vaddr + header.p_memsz);
        }
    }
    std::stable_sort(layout.loads.begin(), layout.loads.end(),
                     [](const LoadSegment& a, const LoadSegment& b) { return a.address < b.address; });
    return layout.loads.empty() || !areApart(layout.loads) ? std::nullopt : std::optional(std::move(layout));
}

} // namespace tally::platform
