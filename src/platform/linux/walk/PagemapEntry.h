// Entries of /proc/PID/pagemap.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/walk/PageStates.h"

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

/// Whether entries tell frame numbers, which takes rights.
bool framesAreTold();

/// What an entry shows; absent for no page, guards and, as far as frames are told, the kernel's zero page.
std::optional<PageKind> kindOfPagemapEntry(std::uint64_t entry, bool inPrivateAnonymous);

} // namespace tally::platform
