#include "platform/linux/objects/MapFiles.h"

#include "base/Format.h"
#include "platform/linux/io/SystemFiles.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <cerrno>

namespace tally::platform {

namespace {

// As the kernel lays them out (include/uapi/linux/mman.h of 6.5); the installed headers are older.
struct cachestat_range {
    std::uint64_t off;
    std::uint64_t len;
};
struct cachestat_counts {
    std::uint64_t nr_cache;
    std::uint64_t nr_dirty;
    std::uint64_t nr_writeback;
    std::uint64_t nr_evicted;
    std::uint64_t nr_recently_evicted;
};
constexpr long cachestatCall = 451;

/// Where no disk is behind a mount, the list of mappings can name another device than the file itself does,
/// as with subvolumes.
bool isFileOf(const Descriptor& file, const Mapping& mapping) {
    struct stat status {};
    return fstat(file.number(), &status) == 0 && S_ISREG(status.st_mode) && status.st_ino == mapping.inode &&
           major(status.st_dev) == mapping.deviceMajor &&
           (minor(status.st_dev) == mapping.deviceMinor || mapping.deviceMajor == 0);
}

} // namespace

std::string mapFilePath(const std::string& folder, const Mapping& mapping) {
    return formatted("%s/map_files/%llx-%llx", folder.c_str(), static_cast<unsigned long long>(mapping.start),
                     static_cast<unsigned long long>(mapping.end));
}

Descriptor openRegularFile(const std::string& path) {
    struct stat status {};
    if (stat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
        return Descriptor();
    }
    return Descriptor(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
}

Descriptor openMappedFile(const std::string& folder, const Mapping& mapping) {
    Descriptor file = openRegularFile(mapFilePath(folder, mapping));
    if (!file.isOpen() && mapping.name.starts_with('/')) {
        // Without the right to follow that link: by name, as the process sees it, if it is still the same
        // file.
        file = openRegularFile(folder + "/root" + mapping.name);
        if (file.isOpen() && !isFileOf(file, mapping)) {
            return Descriptor();
        }
    }
    return file;
}

std::optional<CachedPages> cachedPages(const Descriptor& file, std::uint64_t offset, std::uint64_t length) {
    if (length == 0) {
        return CachedPages(); // to the kernel a length of 0 is everything to the end
    }
    cachestat_range range{offset, length};
    cachestat_counts counts{};
    if (!file.isOpen() || syscall(cachestatCall, file.number(), &range, &counts, 0) != 0) {
        return std::nullopt;
    }
    return CachedPages{counts.nr_cache, counts.nr_dirty + counts.nr_writeback, counts.nr_evicted};
}

} // namespace tally::platform
