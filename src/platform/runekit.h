// Symbol inspection: the image segments of a task, and symbols of the kernel.

#pragma once

#include "platform/kern_return.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

struct RKSegment {
    std::uint64_t start = 0;
    std::uint64_t size = 0; // bytes
    std::string name;       // "__TEXT", "MACH_HEADER", ...; may be empty
};

/// One loaded image.
struct RKSymbolOwner {
    std::string path;
    std::uint64_t base_address = 0;
    std::vector<RKSegment> segments;
};

/// Calls `handler` once per image that `task` has loaded, without reading symbols. Calls nothing where images
/// cannot be listed.
void RKForeachSymbolOwner(mach_port_t task, const std::function<void(const RKSymbolOwner&)>& handler);

/// `path` with symbolic links resolved as the task sees them; unchanged when that fails.
std::string RKResolvedPath(mach_port_t task, std::string_view path);

/// Symbols of the running kernel.
class RKKernelSymbolicator {
  public:
    virtual ~RKKernelSymbolicator() = default;
    /// Name of the symbol that contains `address`.
    virtual std::optional<std::string> symbolName(std::uint64_t address) const = 0;
    struct SourceInfo {
        std::string path;
        int line = 0;
    };
    virtual std::optional<SourceInfo> sourceInfo(std::uint64_t address) const = 0;
};

/// A symbolicator for the running kernel; null where there is none.
std::unique_ptr<RKKernelSymbolicator> RKCreateKernelSymbolicator();

} // namespace tally::platform
