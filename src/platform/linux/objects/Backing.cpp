#include "platform/linux/objects/Backing.h"

#include "platform/linux/objects/FileSystems.h"
#include "platform/linux/objects/FilesAhead.h"
#include "platform/linux/objects/MapFiles.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"

#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <optional>
#include <string_view>

namespace tally::platform {

namespace {

/// What stands behind the mapping, or the descriptor, where that is known at once: absent too where the file
/// system could keep us waiting.
std::optional<struct stat> statusOf(const Mapping& mapping, const std::string& folder,
                                    const std::string& descriptor) {
    struct stat status {};
    if (FilesAhead::ofThisThread() != nullptr || !isLocalFileSystem(mapping, folder, descriptor)) {
        return std::nullopt;
    }
    if (stat((descriptor.empty() ? mapFilePath(folder, mapping) : descriptor).c_str(), &status) == 0) {
        return status;
    }
    const Descriptor found = descriptor.empty() ? findByName(folder, mapping) : Descriptor();
    return found.isOpen() && fstat(found.number(), &status) == 0 ? std::optional(status) : std::nullopt;
}

/// What is not known to be something else is taken for one.
bool isRegularFile(const std::optional<struct stat>& status) { return !status || S_ISREG(status->st_mode); }

/// Whether a mapping of the kernel's internal mounts has no name that a user gave it a path by.
bool isNameless(std::string_view name) {
    return name.starts_with("/memfd:") || name.starts_with("/SYSV") || name == "/dev/zero (deleted)" ||
           name.starts_with("/anon_hugepage") || name.starts_with("[anon_shmem:") || name.empty();
}

} // namespace

BackingObject backingOf(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    BackingObject object;
    if (!mapping.isFileBacked()) {
        object.backing = mapping.isKernelSpecial() ? Backing::special : Backing::anonymous;
        return object;
    }
    if (const FilesAhead* ahead = FilesAhead::ofThisThread(); ahead != nullptr) {
        if (const BackingObject* known = ahead->objectOf(mapping)) {
            return *known;
        }
    }
    object.device = mapping.device();
    object.inode = mapping.inode;
    const FileSystemKind system = kindOfFileSystem(mapping, folder, descriptor);
    const bool internal = mapping.deviceMajor == 0 &&
                          (mapping.deviceMinor == internalMount || system == FileSystemKind::hugetlb);
    object.hasName = !(internal && isNameless(mapping.name));
    object.isSysV = internal && mapping.name.starts_with("/SYSV");
    if (system == FileSystemKind::hugetlb || mapping.pageSize > basePage) {
        object.backing = Backing::hugetlb;
    } else if (mapping.name.starts_with("anon_inode:") ||
               (mapping.name.starts_with("/dev/") && !internal &&
                !isRegularFile(statusOf(mapping, folder, descriptor)))) {
        object.backing = Backing::device; // device files live on a tmpfs too
    } else {
        object.backing = system == FileSystemKind::sharedMemory ? Backing::sharedMemory : Backing::file;
    }
    if (system == FileSystemKind::subvolumes) {
        // Files of two subvolumes can have one (device, inode) in the list of mappings; the file itself knows
        // better.
        if (const std::optional<struct stat> status = statusOf(mapping, folder, descriptor)) {
            object.device = std::uint64_t{major(status->st_dev)} << 32 | minor(status->st_dev);
        }
    }
    return object;
}

} // namespace tally::platform
