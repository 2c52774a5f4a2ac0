#include "platform/linux/objects/MapFiles.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"

#include "base/Format.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/objects/FileSystems.h"
#include "platform/linux/objects/FilesAhead.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <array>
#include <cerrno>

namespace tally::platform {

namespace {

/// @param fileSystem of the file, as statfs gives it. Where no disk is behind a mount, the list of mappings
/// can name another device than the file itself does, as with subvolumes and, on older kernels, overlays.
bool isFileOf(const Mapping& mapping, std::uint32_t deviceMajor, std::uint32_t deviceMinor,
              std::uint64_t inode, std::uint64_t fileSystem) {
    const bool canDiffer =
        deviceMajor == 0 && (mapping.deviceMajor == 0 || fileSystem == OVERLAYFS_SUPER_MAGIC);
    return inode == mapping.inode &&
           (canDiffer || (deviceMajor == mapping.deviceMajor && deviceMinor == mapping.deviceMinor));
}

/// The folders from which the name of a mapping can lead to its file: the process's root, for who lives in
/// other mounts than the tool; the tool's own, for who has only changed its root.
std::array<std::string, 2> rootsOf(const std::string& folder) { return {folder + "/root", systemPath("/")}; }

Descriptor openForStates(const std::string& path) {
    return Descriptor(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
}

} // namespace

Descriptor openRegularFile(const std::string& path) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0) {
        return Descriptor();
    }
    if (!S_ISREG(status.st_mode)) {
        errno = ENOENT;
        return Descriptor();
    }
    return openForStates(path);
}

Descriptor findByName(const std::string& folder, const Mapping& mapping) {
    if (!mapping.name.starts_with('/')) {
        errno = ENOENT;
        return Descriptor();
    }
    int refusal = ENOENT;
    for (const std::string& path : rootsOf(folder)) {
        const Descriptor root(open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        // A file that is mapped is in the kernel's cache of names, and so is the way to it.
        open_how how{.flags = O_PATH | O_CLOEXEC | O_NOFOLLOW, .mode = 0, .resolve = RESOLVE_CACHED};
        Descriptor file(static_cast<int>(
            root.isOpen() ? syscall(SYS_openat2, root.number(), mapping.name.c_str() + 1, &how, sizeof how)
                          : -1));
        struct stat status {};
        struct statfs system {};
        if (!file.isOpen()) {
            refusal = errno == ENOENT ? refusal : errno == EACCES ? EACCES : EAGAIN;
        } else if (fstat(file.number(), &status) == 0 && fstatfs(file.number(), &system) == 0 &&
                   isFileOf(mapping, major(status.st_dev), minor(status.st_dev), status.st_ino,
                            static_cast<std::uint64_t>(system.f_type))) {
            return file;
        }
    }
    errno = refusal;
    return Descriptor();
}

Descriptor openMappedFile(const std::string& folder, const Mapping& mapping) {
    if (const FilesAhead* ahead = FilesAhead::ofThisThread(); ahead != nullptr) {
        errno = ENOENT;
        return ahead->fileOf(mapping);
    }
    if (!isLocalFileSystem(mapping, folder)) {
        errno = EAGAIN;
        return Descriptor();
    }
    Descriptor file = openRegularFile(mapFilePath(folder, mapping));
    if (file.isOpen()) {
        return file;
    }
    // Without the right to follow that link: by name.
    const int refusal = errno;
    const Descriptor found = findByName(folder, mapping);
    file = found.isOpen() ? openRegularFile(systemPath("/proc/self/fd/" + std::to_string(found.number())))
                          : Descriptor();
    errno = isRefusal(errno) ? errno : refusal;
    return file;
}

std::optional<FileAnswer> inquireMappedFile(const std::string& folder, const Mapping& mapping) {
    const bool isLocal = isLocalFileSystem(mapping, folder);
    // On the way to a file of a disk can be anybody's mount.
    const std::uint64_t device = isLocal ? unknownDevice : mapping.device();
    std::optional<FileAnswer> file = inquire(device, mapFilePath(folder, mapping));
    if (file || errno == ETIMEDOUT || !mapping.name.starts_with('/')) {
        return file;
    }
    int refusal = errno;
    for (const std::string& root : rootsOf(folder)) {
        file = inquire(device, root + mapping.name);
        if (file && isFileOf(mapping, file->status.stx_dev_major, file->status.stx_dev_minor,
                             file->status.stx_ino, file->fileSystemType)) {
            return file;
        }
        refusal = !file && isRefusal(errno) ? errno : refusal;
    }
    errno = refusal;
    return std::nullopt;
}

Descriptor openForPageStates(const std::string& folder, const Mapping& mapping) {
    if (FilesAhead::ofThisThread() == nullptr &&
        kindOfFileSystem(mapping, folder) == FileSystemKind::stacked) {
        errno = EOPNOTSUPP;
        return Descriptor();
    }
    return openMappedFile(folder, mapping);
}

} // namespace tally::platform
