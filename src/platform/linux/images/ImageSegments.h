// From the layout of an ELF file and the mappings of a process to the named segments of a loaded image.
//
// A segment ends where its mappings do, so that every mapping lies in one segment. What stands behind a
// mapping (the file, the task's copies, memory without a file) does not matter to its name.

#pragma once

#include "platform/linux/images/ElfLayout.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/runekit.h"

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

namespace tally::platform {

/// How far the image was moved when it was loaded: what is added to its file's addresses, modulo 2^64. Absent
/// when `mapping`, an executable one of its file, shows no executable segment.
std::optional<std::uint64_t> biasOf(const ElfLayout& layout, const Mapping& mapping);

/// The segments, in rising order: "__TEXT", "__LINKEDIT", "__DATA_CONST", "__DATA" and "__BSS".
/// @param mappings all of the process; `file` is one of the image's.
std::vector<RKSegment> segmentsOf(const ElfLayout& layout, std::uint64_t bias, const Mapping& file,
                                  std::span<const Mapping> mappings);

} // namespace tally::platform
