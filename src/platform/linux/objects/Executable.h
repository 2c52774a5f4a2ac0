// The executable of a process, as the process's folder tells of it. No call here waits for a file system.

#pragma once

#include "platform/linux/machine/ProcessStat.h"

#include <cstdint>
#include <optional>
#include <string>

namespace tally::platform {

/// Where the link to the executable of `pid` points: its path, or the path that it had, with " (deleted)".
/// Absent with errno.
std::optional<std::string> executableLink(std::int32_t pid);

/// The path that `link` of `pid` stands for: without the mark of a deleted file, but for a file that is
/// called so.
std::string executablePath(std::int32_t pid, std::string link);

/// Whether the process runs a 64-bit program; one that cannot be looked at is taken to be like the tool.
bool is64bitProgram(const ProcessStat& process);

/// Whether the program of an auxiliary vector is a 64-bit one; absent where it does not say.
std::optional<bool> decodeIs64bit(const std::string& auxiliary);

} // namespace tally::platform
