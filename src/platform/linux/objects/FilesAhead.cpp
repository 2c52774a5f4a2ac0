#include "platform/linux/objects/FilesAhead.h"

#include "platform/linux/gather/MachineState.h"
#include "platform/linux/objects/FileSystems.h"
#include "platform/linux/objects/MapFiles.h"

#include <fcntl.h>

#include <utility>

namespace tally::platform {

namespace {

constexpr std::size_t mostOpened = 256; // smaps stands in for the others

thread_local const FilesAhead* used = nullptr;

} // namespace

FilesAhead::Key FilesAhead::keyOf(const Mapping& mapping) {
    return {deviceOf(mapping), mapping.inode, mapping.name};
}

void FilesAhead::ask(const std::string& folder, std::span<const Mapping> mappings, bool objectView) {
    const bool swapInUse = machineState().swapInUse;
    std::size_t opened = 0;
    for (const Mapping& mapping : mappings) {
        if (!mapping.isFileBacked()) {
            continue;
        }
        Known& known = known_[keyOf(mapping)];
        if (known.object.backing == Backing::anonymous) { // new
            known.object = backingOf(mapping, folder);
        }
        const Backing backing = known.object.backing;
        const bool isAsked = (backing == Backing::sharedMemory && (objectView || swapInUse)) ||
                             (backing == Backing::file && (objectView || mapping.shared));
        if (isAsked && !known.file.isOpen() && opened < mostOpened) {
            known.file = openForPageStates(folder, mapping);
            ++opened;
        }
    }
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
