// ElfLayout: where an ELF file asks to be loaded, from its program headers.

#pragma once

#include "platform/linux/io/Descriptor.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <vector>

namespace tally::platform {

/// One loadable segment. Addresses are the file's own, before it is moved to where it is loaded.
struct LoadSegment {
    std::uint64_t address = 0;
    std::uint64_t memorySize = 0; // bytes, at least fileSize
    std::uint64_t fileOffset = 0;
    std::uint64_t fileSize = 0;
    bool writable = false;
    bool executable = false;

    // Memory is mapped by whole pages.
    std::uint64_t firstPage() const;
    std::uint64_t endOfFilePages() const;
    std::uint64_t endPage() const;
};

struct ElfLayout {
    std::vector<LoadSegment> loads; // by rising address; none overlaps the next
    // What the loader makes read-only once it has relocated it; empty when nothing is.
    std::uint64_t relroStart = 0;
    std::uint64_t relroEnd = 0;
};

/// Fills `bytes` with what stands in a file from `offset` on. @return false when it cannot.
using FileReader = std::function<bool(std::uint64_t offset, std::span<std::byte> bytes)>;

/// Reads the layout from a regular file of either class. Reads the headers only, however large the file is.
/// @return absent when it is no ELF file, has nothing to load, or its headers contradict themselves.
std::optional<ElfLayout> readElfLayout(const FileReader& read);
std::optional<ElfLayout> readElfLayout(const Descriptor& file);

} // namespace tally::platform
