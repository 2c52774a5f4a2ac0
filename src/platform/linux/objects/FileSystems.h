// The file systems behind mappings: what kind of memory their files are, and whether asking a file can wait
// for somebody who never answers. Thread-safe.

#pragma once

#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <string>

namespace tally::platform {

enum class FileSystemKind : std::uint8_t {
    ordinary,
    sharedMemory, // whatever is in memory only
    hugetlb,
    subvolumes, // files of several have one device number in lists of mappings
    stacked,    // the pages are those of a file of another file system
};

inline constexpr std::uint32_t internalMount =
    1; // 00:01, the kernel's own tmpfs: memfds, SysV segments, shared memory

/// The kind of the file system that `mapping` of the process folder `folder` shows a file of.
/// @param descriptor for a file that the process has open instead of mapped: the path of its descriptor.
FileSystemKind kindOfFileSystem(const Mapping& mapping, const std::string& folder,
                                const std::string& descriptor = "");

/// Whether the file system is one whose files this kernel knows by itself, or reads from a disk; others may
/// only be asked by inquire().
bool isLocalFileSystem(const Mapping& mapping, const std::string& folder, const std::string& descriptor = "");

/// Forgets what is known of file systems: their device numbers can be used again.
void forgetFileSystems();

} // namespace tally::platform
