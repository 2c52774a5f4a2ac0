// Memory that a process keeps alive by descriptors.

#pragma once

#include "platform/bsd_process.h"
#include "platform/mach_vm.h"

#include <cstdint>
#include <functional>
#include <string>

namespace tally::platform {

/// Calls `found` once per descriptor of the process folder `folder` that keeps memory alive: memfds and
/// deleted files on a tmpfs, also of huge pages, shared driver buffers, clients of graphics devices and bpf
/// maps that hold any. One object can be found through several descriptors.
/// Cost: a listing and a link a descriptor; more is asked only where the link says that it matters. No
/// descriptor's file is opened, but for those in memory while swap is in use.
/// @return false with errno when the descriptors cannot be listed.
bool forEachHeldObject(const std::string& folder, const std::function<void(const owned_vmobject&)>& found);

} // namespace tally::platform
