// What /proc/PID/fdinfo tells of the memory behind a descriptor.
//
// Pure decoders: unknown keys are passed over, and what a needed key does not tell is absent.

#pragma once

#include "platform/bsd_process.h"
#include "platform/mach_vm.h"

#include <cstdint>
#include <optional>
#include <string_view>

namespace tally::platform {

/// A buffer that drivers share ("/dmabuf:"). Absent when its size or its number is not told, or when its
/// pages are a memfd's, which has them already.
std::optional<owned_vmobject> decodeDmaBuffer(std::string_view text);

/// All that one client has in a graphics device ("/dev/dri/"), without what it shares with others, since
/// whoever holds the shared buffer has that, and without memory on the device, which is none of the
/// machine's.
std::optional<owned_vmobject> decodeGraphicsClient(std::string_view text);

/// A map of the kernel's virtual machine ("anon_inode:bpf-map"). It is not charged: its memory is the
/// kernel's own and counts there.
std::optional<owned_vmobject> decodeBpfMap(std::string_view text);

} // namespace tally::platform
