// Stacks of threads, told by the guard below them.

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace tally::platform {

/// Tags the stacks of threads other than the first among the mappings of the process folder `folder` that are
/// untagged as yet. A stack lies directly above an inaccessible mapping of at most 64 KiB. Where more
/// mappings do than there are threads, only those that a thread's stack pointer points into are stacks.
void tagThreadStacks(const std::string& folder, std::span<const Mapping> mappings,
                     std::span<std::uint32_t> tags);

/// The stack pointer in the text of /proc/PID/task/TID/syscall; absent for a thread that runs.
std::optional<std::uint64_t> decodeStackPointer(std::string_view text);

} // namespace tally::platform
