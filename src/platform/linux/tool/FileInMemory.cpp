// Files as the mappings of processes show them.

#include "platform/output_file.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/pages/ListMappings.h"

#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <filesystem>
#include <system_error>
#include <vector>

namespace tally::platform {

std::optional<FileInMemory> fileInMemory(const std::string& path) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
        return std::nullopt;
    }
    std::error_code ignored;
    const std::uint64_t device = std::uint64_t{major(status.st_dev)} << 32 | minor(status.st_dev);
    return FileInMemory{.path = std::filesystem::canonical(path, ignored),
                        .device = device,
                        .inode = status.st_ino,
                        .object = objectIdOfFile({.device = device, .inode = status.st_ino})};
}

bool mapsFile(std::int32_t pid, const FileInMemory& file) {
    std::vector<Mapping> mappings;
    listMappings(openForReading(processFolder(pid) + "/maps"), &mappings);
    return std::ranges::any_of(mappings, [&](const Mapping& mapping) {
        return mapping.name == file.path || (mapping.inode == file.inode && mapping.device() == file.device);
    });
}

} // namespace tally::platform
