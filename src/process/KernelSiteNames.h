// KernelSiteNames: what the kernel's accounting sites and counters are called.
//
// A site is a tag of the kernel's own table, a loaded module, an address in the kernel's code or a counter.
// Names fall back to numbers; none is ever missing. One gather, one thread.

#pragma once

#include "platform/mach_kernel_memory.h"
#include "platform/runekit.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>

namespace tally {

/// `name`, cut at its first NUL and at the length of the kernel's name fields.
std::string kernelName(const std::string& name);

class KernelSiteNames {
  public:
    /// `zoneNames` stay where they are.
    explicit KernelSiteNames(std::span<const std::string> zoneNames);

    /// The name of a site; one that belongs to a zone names that too.
    std::string regionName(const platform::mach_memory_site& site) const;
    std::string counterName(const platform::mach_memory_site& site) const;
    /// "(file:line)" of a code address, where the kernel's symbols tell.
    std::optional<std::string> sourceOf(std::uint64_t address) const;

  private:
    std::string typeName(std::uint64_t type, std::uint64_t site) const;

    std::span<const std::string> zoneNames_;
    std::map<std::uint64_t, std::string> modules_; // by load tag
    std::unique_ptr<platform::RKKernelSymbolicator> symbolicator_;
};

} // namespace tally
