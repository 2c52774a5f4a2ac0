// Snapshot files as targets.

#pragma once

#include "base/TLError.h"
#include "process/TLProcess.h"

#include <memory>
#include <optional>
#include <string>

namespace tally {

/// The process whose snapshot is the file `path`; null, with the reason in `error` where that is given, when
/// the file cannot be read or is none.
std::shared_ptr<TLProcess> processWithHeapsnap(const std::string& path, std::optional<TLError>* error);

} // namespace tally
