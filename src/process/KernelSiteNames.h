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

// The low 8 bits of a site's flags are its type.
inline constexpr std::uint64_t KernelSiteTypeMask = 0xff;
inline constexpr std::uint64_t KernelSiteIsTag = 0;
inline constexpr std::uint64_t KernelSiteIsModule = 1;
inline constexpr std::uint64_t KernelSiteIsCode = 2;
inline constexpr std::uint64_t KernelSiteIsCounter = 3;
inline constexpr std::uint64_t KernelSiteIsWired = 0x100;
inline constexpr std::uint64_t KernelSiteIsHidden = 0x200;
inline constexpr std::uint64_t KernelSiteIsNamed = 0x400;
inline constexpr std::uint64_t KernelSiteIsOfZone = 0x800;

inline constexpr std::uint64_t KernelTagMlock = 24; // memory that is wired on behalf of user processes

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
