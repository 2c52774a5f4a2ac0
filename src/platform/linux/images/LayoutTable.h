// The layouts of ELF files, read once per run however many processes map a file. Thread-safe.

#pragma once

#include "platform/linux/images/ElfLayout.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/pages/Mapping.h"

#include <memory>
#include <string>

namespace tally::platform {

/// The layout of the file behind `mapping` of the process folder `folder`; `object` says which file it is.
/// Null when it is no ELF file or cannot be read. Within a gather a file is opened once, and read again only
/// when it has changed since the gather before.
std::shared_ptr<const ElfLayout> layoutOfFile(const BackingObject& object, const std::string& folder,
                                              const Mapping& mapping);

/// Begins a gather: files may have changed since the last.
void beginLayouts();

} // namespace tally::platform
