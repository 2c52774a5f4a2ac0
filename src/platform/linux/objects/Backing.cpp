#include "platform/linux/objects/Backing.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/objects/MapFiles.h"

#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/sysmacros.h>

#include <map>
#include <mutex>
#include <optional>
#include <string_view>
#include <utility>

namespace tally::platform {

namespace {

enum class FileSystem : std::uint8_t { ordinary, sharedMemory, hugetlb, subvolumes };

constexpr std::uint32_t internalMount =
    1; // 00:01, the kernel's own tmpfs: memfds, SysV segments, shared memory

std::optional<FileSystem> fileSystemOfType(std::string_view type) {
    return type == "tmpfs" || type == "devtmpfs" ? FileSystem::sharedMemory
           : type == "hugetlbfs"                 ? FileSystem::hugetlb
           : type == "btrfs"                     ? FileSystem::subvolumes
                                                 : FileSystem::ordinary;
}

/// A path that leads to the file, whatever its name is.
std::string pathOf(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    return descriptor.empty() ? mapFilePath(folder, mapping) : descriptor;
}

/// Looks the device up among the mounts that the process sees.
std::optional<FileSystem> fileSystemFromMounts(const Mapping& mapping, const std::string& folder) {
    const std::optional<std::string> mounts = readSystemFile(folder + "/mountinfo");
    const std::string device =
        std::to_string(mapping.deviceMajor) + ":" + std::to_string(mapping.deviceMinor);
    std::string_view text = mounts ? *mounts : std::string_view();
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        takeWord(line); // mount id
        takeWord(line); // its parent
        if (takeWord(line) != device) {
            continue;
        }
        const std::size_t type = line.find(" - ");
        if (type != std::string_view::npos) {
            line.remove_prefix(type + 3);
            return fileSystemOfType(takeWord(line));
        }
    }
    return std::nullopt;
}

FileSystem inspectFileSystem(const Mapping& mapping, const std::string& folder, const std::string& path) {
    // The list of mounts never waits for a server, as a question to the file system could.
    if (const std::optional<FileSystem> mounted = fileSystemFromMounts(mapping, folder)) {
        return *mounted;
    }
    struct statfs status {};
    if (statfs(path.c_str(), &status) == 0) {
        switch (static_cast<std::uint64_t>(status.f_type)) {
        case TMPFS_MAGIC:
            return FileSystem::sharedMemory;
        case HUGETLBFS_MAGIC:
            return FileSystem::hugetlb;
        case BTRFS_SUPER_MAGIC:
            return FileSystem::subvolumes;
        default:
            return FileSystem::ordinary;
        }
    }
    // Only names are left to go by, for the kernel's internal mounts.
    return mapping.pageSize > basePage || mapping.name.starts_with("/anon_hugepage") ? FileSystem::hugetlb
           : mapping.deviceMinor == internalMount ? FileSystem::sharedMemory
                                                  : FileSystem::ordinary;
}

struct FileSystemTable {
    std::mutex mutex;
    std::map<std::uint32_t, FileSystem> byMinor; // of major 0
};

FileSystemTable& fileSystemTable() {
    static FileSystemTable table;
    return table;
}

FileSystem fileSystemOf(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    if (mapping.deviceMajor != 0) {
        return FileSystem::ordinary; // on a disk
    }
    FileSystemTable& table = fileSystemTable();
    const std::scoped_lock lock(table.mutex);
    const auto found = table.byMinor.find(mapping.deviceMinor);
    if (found != table.byMinor.end()) {
        return found->second;
    }
    return table.byMinor[mapping.deviceMinor] =
               inspectFileSystem(mapping, folder, pathOf(mapping, folder, descriptor));
}

bool isRegularFile(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    struct stat status {};
    const bool known = stat(pathOf(mapping, folder, descriptor).c_str(), &status) == 0 ||
                       stat((folder + "/root" + mapping.name).c_str(), &status) == 0;
    return !known || S_ISREG(status.st_mode);
}

/// Whether a mapping of the kernel's internal mounts has no name that a user gave it a path by.
bool isNameless(std::string_view name) {
    return name.starts_with("/memfd:") || name.starts_with("/SYSV") || name == "/dev/zero (deleted)" ||
           name.starts_with("/anon_hugepage") || name.starts_with("[anon_shmem:") || name.empty();
}

} // namespace

void forgetFileSystems() {
    FileSystemTable& table = fileSystemTable();
    const std::scoped_lock lock(table.mutex);
    table.byMinor.clear();
}

BackingObject backingOf(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    BackingObject object;
    if (!mapping.isFileBacked()) {
        object.backing = mapping.isKernelSpecial() ? Backing::special : Backing::anonymous;
        return object;
    }
    object.device = std::uint64_t{mapping.deviceMajor} << 32 | mapping.deviceMinor;
    object.inode = mapping.inode;
    const FileSystem system = fileSystemOf(mapping, folder, descriptor);
    const bool internal =
        mapping.deviceMajor == 0 && (mapping.deviceMinor == internalMount || system == FileSystem::hugetlb);
    object.hasName = !(internal && isNameless(mapping.name));
    object.isSysV = internal && mapping.name.starts_with("/SYSV");
    if (system == FileSystem::hugetlb || mapping.pageSize > basePage) {
        object.backing = Backing::hugetlb;
    } else if (mapping.name.starts_with("/dev/") && !internal &&
               !isRegularFile(mapping, folder, descriptor)) {
        object.backing = Backing::device; // device files live on a tmpfs too
    } else {
        object.backing = system == FileSystem::sharedMemory ? Backing::sharedMemory : Backing::file;
    }
    if (system == FileSystem::subvolumes) {
        // Files of two subvolumes can have one (device, inode) in the list of mappings; the file itself knows
        // better.
        struct stat status {};
        if (stat(pathOf(mapping, folder, descriptor).c_str(), &status) == 0) {
            object.device = std::uint64_t{major(status.st_dev)} << 32 | minor(status.st_dev);
        }
    }
    return object;
}

} // namespace tally::platform
