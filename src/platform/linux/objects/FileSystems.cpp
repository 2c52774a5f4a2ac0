#include "platform/linux/objects/FileSystems.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/objects/FilesAhead.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"

#include <linux/magic.h>

#include <algorithm>
#include <array>
#include <map>
#include <mutex>
#include <optional>
#include <string_view>
#include <utility>

namespace tally::platform {

namespace {

struct FileSystem {
    FileSystemKind kind = FileSystemKind::ordinary;
    bool isLocal = false;
};

FileSystem fileSystemOfType(std::string_view type) {
    // Of any other nobody knows whom it asks. An overlay's files are mostly on one of these.
    constexpr std::array<std::string_view, 25> local{
        "ext4",  "xfs",     "btrfs",    "overlay",  "tmpfs",  "devtmpfs", "ramfs", "rootfs", "hugetlbfs",
        "ext3",  "ext2",    "f2fs",     "bcachefs", "zfs",    "jfs",      "vfat",  "exfat",  "ntfs3",
        "erofs", "iso9660", "squashfs", "udf",      "cramfs", "reiserfs", "nilfs2"};
    constexpr std::array<std::pair<std::string_view, FileSystemKind>, 7> special{
        {{"tmpfs", FileSystemKind::sharedMemory},
         {"devtmpfs", FileSystemKind::sharedMemory},
         {"ramfs", FileSystemKind::sharedMemory},
         {"rootfs", FileSystemKind::sharedMemory},
         {"hugetlbfs", FileSystemKind::hugetlb},
         {"btrfs", FileSystemKind::subvolumes},
         {"overlay", FileSystemKind::stacked}}};
    const auto* const found = std::ranges::find(special, type, &decltype(special)::value_type::first);
    return {found == special.end() ? FileSystemKind::ordinary : found->second,
            std::ranges::find(local, type) != local.end()};
}

/// Looks the device up in a list of mounts.
std::optional<FileSystem> findMounted(const Mapping& mapping, const std::string& mountinfo) {
    const std::string device =
        std::to_string(mapping.deviceMajor) + ":" + std::to_string(mapping.deviceMinor);
    std::string_view text = mountinfo;
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

/// Of what is not mounted, or nowhere to be seen: asked of the file, or guessed by its name.
FileSystem fileSystemOfFile(const Mapping& mapping, const std::string& path) {
    if (mapping.deviceMajor != 0) {
        return {FileSystemKind::ordinary, true}; // a disk
    }
    if (mapping.deviceMinor == internalMount) {
        return {FileSystemKind::sharedMemory, true};
    }
    const std::optional<FileAnswer> file =
        FilesAhead::ofThisThread() == nullptr ? inquire(mapping.device(), path) : std::nullopt;
    if (file) {
        switch (file->fileSystemType) {
        case TMPFS_MAGIC:
            return {FileSystemKind::sharedMemory, true};
        case HUGETLBFS_MAGIC:
            return {FileSystemKind::hugetlb, true};
        case BTRFS_SUPER_MAGIC:
            return {FileSystemKind::subvolumes, true};
        default:
            return {FileSystemKind::ordinary, false};
        }
    }
    const bool isHuge = mapping.pageSize > basePage || mapping.name.starts_with("/anon_hugepage");
    return {isHuge ? FileSystemKind::hugetlb : FileSystemKind::ordinary, false};
}

struct FileSystemTable {
    std::mutex mutex;
    std::map<std::uint64_t, FileSystem> byDevice;
};

FileSystemTable& fileSystemTable() {
    static FileSystemTable table;
    return table;
}

FileSystem fileSystemOf(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    FileSystemTable& table = fileSystemTable();
    const std::scoped_lock lock(table.mutex);
    const auto found = table.byDevice.find(mapping.device());
    if (found != table.byDevice.end()) {
        return found->second;
    }
    // The lists of mounts never wait for a server, as a question to the file system could. The process and
    // the tool may see different ones.
    std::optional<FileSystem> system;
    for (const std::string& list : {folder + "/mountinfo", systemPath("/proc/self/mountinfo")}) {
        system = system ? system : findMounted(mapping, readSystemFile(list).value_or(""));
    }
    if (!system) {
        system = fileSystemOfFile(mapping, descriptor.empty() ? mapFilePath(folder, mapping) : descriptor);
    }
    return table.byDevice[mapping.device()] = *system;
}

} // namespace

FileSystemKind kindOfFileSystem(const Mapping& mapping, const std::string& folder,
                                const std::string& descriptor) {
    return mapping.deviceMajor != 0 ? FileSystemKind::ordinary
                                    : fileSystemOf(mapping, folder, descriptor).kind;
}

bool isLocalFileSystem(const Mapping& mapping, const std::string& folder, const std::string& descriptor) {
    return fileSystemOf(mapping, folder, descriptor).isLocal;
}

void forgetFileSystems() {
    FileSystemTable& table = fileSystemTable();
    const std::scoped_lock lock(table.mutex);
    table.byDevice.clear();
}

} // namespace tally::platform
