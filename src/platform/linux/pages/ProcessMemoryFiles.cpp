#include "platform/linux/pages/ProcessMemoryFiles.h"

#include "base/Format.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/pages/ListMappings.h"

#include <cerrno>
#include <utility>

namespace tally::platform {

kern_return_t statusForErrno(int error) {
    return error == EACCES || error == EPERM                       ? KERN_NO_ACCESS
           : error == EMFILE || error == ENFILE || error == ENOMEM ? KERN_FAILURE
                                                                   : KERN_INVALID_ARGUMENT;
}

std::string mapFilePath(const std::string& folder, const Mapping& mapping) {
    return formatted("%s/map_files/%llx-%llx", folder.c_str(), static_cast<unsigned long long>(mapping.start),
                     static_cast<unsigned long long>(mapping.end));
}

namespace {

bool firstThreadHasEnded(std::int32_t pid) {
    const std::optional<ProcessStat> stat = readProcessStat(pid);
    return stat && stat->state == 'Z';
}

} // namespace

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
    if (status == KERN_NO_ACCESS && firstThreadHasEnded(pid)) {
        status = KERN_INVALID_ARGUMENT; // of a thread that has ended nothing is shown to ordinary users
    }
    if (status == KERN_INVALID_ARGUMENT) {
        for (std::string& thread : threadFolders(pid)) {
            status = openFolder(std::move(thread), mappings);
            if (status == KERN_SUCCESS) {
                break;
            }
        }
    }
    // Only now is it certain whose files were opened: the pid may have been used again.
    const std::optional<ProcessStat> stat = readProcessStat(pid);
    if (!stat) {
        return statusForErrno(errno);
    }
    return stat->startTicks == startTicks ? status : KERN_INVALID_ARGUMENT;
}

} // namespace tally::platform
