// The form of a corpse's crash information: items, each a header and its payload, between two markers.

#pragma once

#include <cstdint>

namespace tally::platform {

struct KcdataHeader {
    std::uint32_t type = 0;
    std::uint32_t payloadSize = 0; // bytes, with padding
    std::uint64_t flags = 0;       // by how many bytes it is padded
};
static_assert(sizeof(KcdataHeader) == 16);

// Types of items.
inline constexpr std::uint32_t kcdataBegin = 0xDEADF157;
inline constexpr std::uint32_t kcdataEnd = 0xF19158ED;
inline constexpr std::uint32_t kcdataArray = 0x11;
inline constexpr std::uint32_t kcdataFirstPaddedArray = 0x20; // one for each of 0 to 15 bytes of padding
inline constexpr std::uint32_t crashPid = 0x805;              // 32 bits, as flags
inline constexpr std::uint32_t crashPath = 0x80F;             // text that ends with a NUL
inline constexpr std::uint32_t crashFlags = 0x815;
inline constexpr std::uint32_t crashDirtyFlags = 0x819;
inline constexpr std::uint32_t crashPageTable = 0x825; // bytes, 64 bits, as the two below
inline constexpr std::uint32_t crashPhysTally = 0x826;
inline constexpr std::uint32_t crashPhysTallyPeak = 0x827;

// Of the flags.
inline constexpr std::uint32_t crashFlag64bit = 0x4;
inline constexpr std::uint32_t crashFlagTranslated = 0x20000;

} // namespace tally::platform
