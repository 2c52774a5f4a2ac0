// The files behind mappings, opened.
//
// A target's file is only ever asked for the state of its pages: its bytes are not read, it is not mapped,
// and nothing but regular files is opened.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <optional>
#include <string>

namespace tally::platform {

/// Opens `path` for reading if a regular file is there: opening anything else can wait, or act on a device.
Descriptor openRegularFile(const std::string& path);

/// Finds the file behind `mapping` by its name, as the process sees it, if it is still the same file. The
/// descriptor is not for reading. Not open with EAGAIN when the way there is not known at once, as where a
/// server is on it.
Descriptor findByName(const std::string& folder, const Mapping& mapping);

/// Opens the file behind `mapping`. Not open, with errno, when it is no regular file, may not be opened, or
/// is on a file system that could keep us waiting (EAGAIN).
Descriptor openMappedFile(const std::string& folder, const Mapping& mapping);

/// The same, to ask for the states of its pages: not open where these are another file's, as on an overlay.
Descriptor openForPageStates(const std::string& folder, const Mapping& mapping);

/// What is known of the file behind `mapping` by a question that is given up when it takes too long; absent
/// with errno.
std::optional<FileAnswer> inquireMappedFile(const std::string& folder, const Mapping& mapping);

} // namespace tally::platform
