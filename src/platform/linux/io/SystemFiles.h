// Reading the kernel's files below /proc and /sys.
//
// All paths are below one root, "/" but for tests that bring a tree of their own. Calls that fail leave
// errno. Thread-safe.

#pragma once

#include "platform/linux/io/Descriptor.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

/// Sets the folder below which "/proc" and "/sys" are looked for; "" is the machine's own. Before any other
/// call.
void setSystemRoot(std::string root);

/// `path` ("/proc/...") below the root.
std::string systemPath(std::string_view path);

/// The folder of process `pid`: "/proc/<pid>" below the root.
std::string processFolder(std::int32_t pid);

/// Opens the file at `path`, which the calls above made, for reading. Not open on failure, with errno.
Descriptor openForReading(const std::string& path);

/// Reads from `file` to its end into `text` (replaced). @return false on failure, with errno; `text` then
/// holds what came before.
bool readToEnd(const Descriptor& file, std::string& text);

/// Reads from `file` to its end and hands on what it reads, a block of whole lines at a time: for texts that
/// grow with the process that they tell of. @return as readToEnd.
bool readLines(const Descriptor& file, const std::function<void(std::string_view lines)>& take);

/// Fills `bytes` with what stands in `file` from `offset` on. @return false when it cannot be read or ends
/// before.
bool readExactly(const Descriptor& file, std::uint64_t offset, std::span<std::byte> bytes);

/// The whole file at `path`; absent on failure, with errno.
std::optional<std::string> readSystemFile(const std::string& path);

/// The same for a file that the kernel makes as one record, as it does those that tell of a whole process:
/// what the first read gives is all, unless it fills the buffer.
std::optional<std::string> readSystemRecord(const std::string& path);

/// The entries of the folder at `path` whose names are numbers, in rising order; absent on failure, with
/// errno.
std::optional<std::vector<std::int32_t>> listNumbered(const std::string& path);

/// Makes room for `count` more descriptors than are usual; but for root, as far as the hard limit goes.
void allowDescriptors(std::size_t count);

/// Where the symbolic link at `path` points, up to 64 KiB; absent on failure, with errno.
std::optional<std::string> readSystemLink(const std::string& path);

} // namespace tally::platform
