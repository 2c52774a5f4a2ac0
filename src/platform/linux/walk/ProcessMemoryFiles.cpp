#include "platform/linux/walk/ProcessMemoryFiles.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/processes/ProcessStat.h"
#include "platform/linux/walk/ListMappings.h"

#include <dirent.h>

#include <cerrno>
#include <memory>

namespace tally::platform {

namespace {

std::vector<std::string> threadFolders(std::int32_t pid) {
    const std::string parent = processFolder(pid) + "/task";
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(parent.c_str()), closedir);
    std::vector<std::string> folders;
    while (folder) {
        const dirent* entry = readdir(folder.get());
        if (entry == nullptr) {
            break;
        }
        if (entry->d_name[0] != '.' && entry->d_name != std::to_string(pid)) {
            folders.push_back(parent + "/" + entry->d_name);
        }
    }
    return folders;
}

} // namespace

kern_return_t statusForErrno(int error) {
    return error == EACCES || error == EPERM                       ? KERN_NO_ACCESS
           : error == EMFILE || error == ENFILE || error == ENOMEM ? KERN_FAILURE
                                                                   : KERN_INVALID_ARGUMENT;
}

kern_return_t ProcessMemoryFiles::openFolder(std::string path, std::vector<Mapping>* mappings) {
    folder = std::move(path);
    maps = openForReading(folder + "/maps");
    if (!maps.isOpen()) {
        return statusForErrno(errno);
    }
    pagemap = openForReading(folder + "/pagemap");
    if (!pagemap.isOpen()) {
        return statusForErrno(errno);
    }
    if (!listMappings(maps, mappings)) {
        return statusForErrno(errno);
    }
    return mappings->empty() ? KERN_INVALID_ARGUMENT : KERN_SUCCESS;
}

kern_return_t ProcessMemoryFiles::open(std::int32_t pid, std::uint64_t startTicks,
                                       std::vector<Mapping>* mappings) {
    kern_return_t status = openFolder(processFolder(pid), mappings);
    if (status == KERN_INVALID_ARGUMENT) {
        // A leader that ended before its threads shows no mappings, while its threads do.
        for (std::string& thread : threadFolders(pid)) {
            status = openFolder(std::move(thread), mappings);
            if (status == KERN_SUCCESS) {
                break;
            }
        }
    }
    // Only now is it certain whose files were opened: the pid may have been used again.
    const std::optional<ProcessStat> stat = readProcessStat(pid);
    if (!stat || stat->startTicks != startTicks) {
        return KERN_INVALID_ARGUMENT;
    }
    return status;
}

} // namespace tally::platform
