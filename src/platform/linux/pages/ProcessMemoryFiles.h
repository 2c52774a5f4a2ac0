// The files of one process that a walk reads, opened together.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/io/Descriptor.h"
#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <string>
#include <vector>

namespace tally::platform {

/// A descriptor is bound to the address space that the process had when it was opened: after an exec or the
/// end of the process, reads give nothing and ioctls ESRCH.
struct ProcessMemoryFiles {
    std::string folder; // "/proc/PID", or that of a thread when the leader has ended before its threads
    Descriptor maps;
    Descriptor pagemap;

    /// Opens the files of process `pid`, which must still be the one that started at `startTicks`, and lists
    /// its mappings in rising order.
    /// @return KERN_SUCCESS; KERN_INVALID_ARGUMENT when it has ended or has no mappings; KERN_NO_ACCESS.
    kern_return_t open(std::int32_t pid, std::uint64_t startTicks, std::vector<Mapping>* mappings);

  private:
    kern_return_t openFolder(std::string path, std::vector<Mapping>* mappings);
};

/// The path by which the file behind a mapping of the process folder is reached, whatever its name is.
std::string mapFilePath(const std::string& folder, const Mapping& mapping);

/// The status that stands for a failed call on a process's file.
kern_return_t statusForErrno(int error);

} // namespace tally::platform
