#include "platform/linux/images/ElfLayout.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/Mapping.h"

#include <gelf.h>
#include <libelf.h>

#include <algorithm>
#include <cstddef>
#include <limits>
#include <memory>
#include <span>

namespace tally::platform {

namespace {

constexpr std::size_t mostHeaders = 4096; // linkers make a dozen; a damaged file can claim billions

std::uint64_t pageBelow(std::uint64_t address) { return address & ~(basePage - 1); }

/// Whether a segment can be mapped at all: no end beyond the last page, and address and offset alike within
/// a page.
bool isMappable(const LoadSegment& load) {
    const std::uint64_t most = std::numeric_limits<std::uint64_t>::max() - 2 * basePage;
    return load.memorySize <= most && load.address <= most - load.memorySize &&
           load.fileOffset <= most - load.fileSize && load.fileSize <= load.memorySize &&
           (load.fileSize == 0 || (load.address - load.fileOffset) % basePage == 0);
}

using ElfHandle = std::unique_ptr<Elf, int (*)(Elf*)>;

ElfHandle elfOf(std::vector<char>& bytes) {
    static const bool isReady = elf_version(EV_CURRENT) != EV_NONE;
    return {isReady ? elf_memory(bytes.data(), bytes.size()) : nullptr, elf_end};
}

/// None when they cannot be read. The library is given a copy of the headers alone: of a whole file it makes
/// a record of every section too, and a file of 4 KiB can claim billions.
std::vector<GElf_Phdr> programHeaders(const FileReader& read) {
    std::vector<char> bytes(sizeof(Elf64_Ehdr)); // of both classes: a file with something to load is longer
    GElf_Ehdr header;
    if (!read(0, std::as_writable_bytes(std::span(bytes))) ||
        gelf_getehdr(elfOf(bytes).get(), &header) == nullptr || header.e_phnum > mostHeaders) {
        return {};
    }
    const std::size_t start = bytes.size();
    const std::size_t size = gelf_fsize(elfOf(bytes).get(), ELF_T_PHDR, header.e_phnum, EV_CURRENT);
    bytes.resize(start + size);
    const ElfHandle elf = elfOf(bytes);
    const bool isRead = read(header.e_phoff, std::as_writable_bytes(std::span(bytes).subspan(start)));
    header.e_phoff = start;
    if (!isRead || gelf_update_ehdr(elf.get(), &header) == 0) {
        return {};
    }
    std::vector<GElf_Phdr> headers(header.e_phnum);
    for (int i = 0; i < header.e_phnum; ++i) {
        if (gelf_getphdr(elf.get(), i, &headers[i]) == nullptr) {
            return {};
        }
    }
    return headers;
}

bool areApart(const std::vector<LoadSegment>& loads) {
    return std::adjacent_find(loads.begin(), loads.end(), [](const LoadSegment& a, const LoadSegment& b) {
               return b.address < a.address + a.memorySize;
           }) == loads.end();
}

} // namespace

std::uint64_t LoadSegment::firstPage() const { return pageBelow(address); }
std::uint64_t LoadSegment::endOfFilePages() const {
    return fileSize == 0 ? firstPage() : wholePages(address + fileSize);
}
std::uint64_t LoadSegment::endPage() const { return wholePages(address + memorySize); }

std::optional<ElfLayout> readElfLayout(const Descriptor& file) {
    return readElfLayout(
        [&](std::uint64_t offset, std::span<std::byte> bytes) { return readExactly(file, offset, bytes); });
}

std::optional<ElfLayout> readElfLayout(const FileReader& read) {
    ElfLayout layout;
    for (const GElf_Phdr& header : programHeaders(read)) {
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
