#include "platform/linux/objects/FilesAhead.h"

#include <fcntl.h>

#include <utility>

namespace tally::platform {

namespace {

thread_local const FilesAhead* used = nullptr;

} // namespace

FilesAhead::Key FilesAhead::keyOf(const Mapping& mapping) {
    return {mapping.device(), mapping.inode, mapping.name};
}

const BackingObject* FilesAhead::objectOf(const Mapping& mapping) const {
    const auto found = known_.find(keyOf(mapping));
    return found == known_.end() ? nullptr : &found->second.object;
}

Descriptor FilesAhead::fileOf(const Mapping& mapping) const {
    const auto found = known_.find(keyOf(mapping));
    const bool isOpen = found != known_.end() && found->second.file.isOpen();
    return Descriptor(isOpen ? fcntl(found->second.file.number(), F_DUPFD_CLOEXEC, 0) : -1);
}

const FilesAhead* FilesAhead::ofThisThread() { return used; }

FilesAhead::Use::Use(const FilesAhead& ahead) { used = &ahead; }
FilesAhead::Use::~Use() { used = nullptr; }

} // namespace tally::platform
