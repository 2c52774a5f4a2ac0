// The tags of memory that only this system has, and what they are called.
//
// Tags are slots of the tool's table of names. Those that the table leaves free are used here: a few for
// fixed kinds of memory, the rest for the names that programs give to anonymous memory, in the order in which
// they are met in a run. Thread-safe.

#pragma once

#include <cstdint>
#include <string_view>

namespace tally::platform {

namespace tags {

// Of the tool's table.
inline constexpr std::uint32_t untagged = 0;
inline constexpr std::uint32_t mallocArena = 2;
inline constexpr std::uint32_t mallocLarge = 3;
inline constexpr std::uint32_t breakHeap = 5;
inline constexpr std::uint32_t stack = 30;
inline constexpr std::uint32_t guard = 31;
inline constexpr std::uint32_t java = 44;
inline constexpr std::uint32_t loaderMalloc = 61;
inline constexpr std::uint32_t scriptCode = 64;

// Of this system.
inline constexpr std::uint32_t sharedAnonymous = 100;
inline constexpr std::uint32_t sharedMemfd = 101;
inline constexpr std::uint32_t sharedSysV = 102;
inline constexpr std::uint32_t hugePagePool = 103;
inline constexpr std::uint32_t kernelPages = 104;
inline constexpr std::uint32_t goHeap = 105;
inline constexpr std::uint32_t jemalloc = 106;
inline constexpr std::uint32_t generatedCode = 107; // by whatever program: also for patterns or foreign calls
inline constexpr std::uint32_t otherNamed = 109;    // when there are more names than slots
inline constexpr std::uint32_t firstNamed = 110;
inline constexpr std::uint32_t lastNamed = 239;

} // namespace tags

/// The tag of anonymous memory that its program has called `name`: that of the kind of memory which the name
/// stands for, else a slot of its own.
std::uint32_t tagOfName(std::string_view name);

} // namespace tally::platform
