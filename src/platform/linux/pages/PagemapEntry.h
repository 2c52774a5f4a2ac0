// Entries of /proc/PID/pagemap.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/pages/PageStates.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

namespace tally::platform {

namespace pagemap {
inline constexpr std::uint64_t present = std::uint64_t{1} << 63;
inline constexpr std::uint64_t swapped = std::uint64_t{1} << 62;
inline constexpr std::uint64_t file = std::uint64_t{1} << 61; // or shared memory
inline constexpr std::uint64_t guard = std::uint64_t{1} << 58;
inline constexpr std::uint64_t exclusive = std::uint64_t{1} << 56; // mapped once
/// Frame number, or where in swap; reads as 0 without the right to see it.
inline constexpr std::uint64_t place = (std::uint64_t{1} << 55) - 1;
} // namespace pagemap

/// Reads the entries from the page of `address` on. @return how many were read, 0 on failure.
std::size_t readPagemapEntries(const Descriptor& pagemap, std::uint64_t address,
                               std::span<std::uint64_t> entries);

/// The frame of the kernel's zero page, learnt from a page of our own that was only read; 0 when frames are
/// hidden.
std::uint64_t zeroFrame();

/// Whether entries tell frame numbers, which takes rights.
inline bool framesAreTold() { return zeroFrame() != 0; }

/// What an entry shows; absent for no page, guards and, as far as frames are told, the zero page.
inline std::optional<PageKind> kindOfPagemapEntry(std::uint64_t entry, bool inPrivateAnonymous,
                                                  std::uint64_t zeroFrame) {
    if ((entry & pagemap::guard) != 0 || (entry & (pagemap::present | pagemap::swapped)) == 0) {
        return std::nullopt;
    }
    const std::uint64_t frame = entry & pagemap::place;
    const bool isPresent = (entry & pagemap::present) != 0;
    const bool isOfFile = (entry & pagemap::file) != 0;
    if (isPresent && (isOfFile ? inPrivateAnonymous : frame != 0 && frame == zeroFrame)) {
        return std::nullopt; // the huge zero page shows as a file's, the ordinary one by its frame
    }
    return isOfFile ? PageKind::object : isPresent ? PageKind::anonymous : PageKind::swapped;
}

} // namespace tally::platform
