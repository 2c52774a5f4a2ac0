#include "platform/linux/owned/HeldFiles.h"

#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/MachineState.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/objects/MapFiles.h"
#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/objects/PageCache.h"
#include "platform/linux/owned/DescriptorInfo.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <memory>
#include <optional>
#include <string_view>

namespace tally::platform {

namespace {

constexpr std::uint64_t blockSize = 512;

constexpr const char* descriptorsUnread = "Descriptors could not be looked at";
constexpr const char* memoryLeftOut = "memory that only they keep is left out";

/// What is known of the file will do: asking a server could take long.
/// @param link where the descriptor leads, as the kernel shows it.
bool readStatus(const std::string& descriptor, std::string_view link, struct statx& status) {
    if (statx(AT_FDCWD, descriptor.c_str(), AT_STATX_DONT_SYNC, STATX_BASIC_STATS, &status) == 0) {
        return true;
    }
    if (errno == ENOENT || errno == ESRCH) {
        return false;
    }
    // Filters that do not know the newer call refuse it. Nobody stands behind a memfd; others are asked with
    // a bound.
    if (link.starts_with("/memfd:")) {
        return statusByOlderCall(descriptor.c_str(), status);
    }
    const std::optional<FileAnswer> answer = inquire(unknownDevice, descriptor);
    if (answer) {
        status = answer->status;
    }
    return answer.has_value();
}

/// A file without a name that only its descriptors, or mappings, keep: absent when it is none in memory.
std::optional<owned_vmobject> memoryFile(const std::string& folder, const std::string& descriptor,
                                         std::string_view link) {
    struct statx status {};
    if (!readStatus(descriptor, link, status)) {
        noteRefusal(descriptorsUnread, errno, memoryLeftOut);
        return std::nullopt;
    }
    if (!S_ISREG(status.stx_mode) || status.stx_nlink != 0 || status.stx_dev_major != 0) {
        return std::nullopt;
    }
    Mapping file;
    file.deviceMajor = status.stx_dev_major;
    file.deviceMinor = status.stx_dev_minor;
    file.inode = status.stx_ino;
    file.name = link;
    const BackingObject object = backingOf(file, folder, descriptor);
    const bool isHuge = object.backing == Backing::hugetlb;
    if (!isHuge && object.backing != Backing::sharedMemory) {
        return std::nullopt;
    }
    owned_vmobject record{.purgeable = VM_PURGABLE_DENY};
    record.id = objectIdOfFile(object);
    record.residentSize = status.stx_blocks * blockSize; // what is swapped out included
    record.virtualSize = std::max<std::uint64_t>(status.stx_size, record.residentSize);
    if (isHuge) {
        record.wiredSize = record.residentSize;
    } else if (record.residentSize != 0 && machineState().swapInUse) {
        const auto pages = cachedOrHeldPages(openRegularFile(descriptor), 0, record.virtualSize);
        if (!pages) {
            noteRefusal("Files in memory that it holds could not be asked", errno,
                        "what of them is swapped out counts as in memory");
        }
        record.compressedSize = std::min(pages ? pages->evicted * basePage : 0, record.residentSize);
        record.residentSize -= record.compressedSize;
    }
    return record;
}

std::optional<owned_vmobject> recordOf(const std::string& folder, const char* number, std::string_view link) {
    if (link.starts_with('/') && link.ends_with(" (deleted)")) {
        return memoryFile(folder, folder + "/fd/" + number, link);
    }
    const auto decode = link.starts_with("/dmabuf") || link == "anon_inode:dmabuf" ? decodeDmaBuffer
                        : link.starts_with("/dev/dri/")                            ? decodeGraphicsClient
                        : link == "anon_inode:bpf-map"                             ? decodeBpfMap
                                                                                   : nullptr;
    if (decode == nullptr) {
        return std::nullopt;
    }
    const std::optional<std::string> text = readSystemRecord(folder + "/fdinfo/" + number);
    if (!text) {
        noteRefusal(descriptorsUnread, errno, memoryLeftOut);
    }
    return text ? decode(*text) : std::nullopt;
}

} // namespace

bool forEachHeldObject(const std::string& folder, const std::function<void(const owned_vmobject&)>& found) {
    const std::unique_ptr<DIR, int (*)(DIR*)> descriptors(opendir((folder + "/fd").c_str()), closedir);
    if (!descriptors) {
        const int error = errno;
        noteRefusal(descriptorsUnread, error, memoryLeftOut);
        errno = error;
        return false;
    }
    std::array<char, PATH_MAX> link; // the kernel shows no longer one
    errno = 0;
    for (const dirent* entry = nullptr; (entry = readdir(descriptors.get())) != nullptr; errno = 0) {
        const char* const number = entry->d_name;
        if (number[0] == '.') {
            continue; // the folder itself and the one above
        }
        const ssize_t length = readlinkat(dirfd(descriptors.get()), number, link.data(), link.size());
        if (length <= 0) { // closed meanwhile, or refused
            noteRefusal(descriptorsUnread, errno, memoryLeftOut);
            continue;
        }
        auto record = recordOf(folder, number, {link.data(), static_cast<std::size_t>(length)});
        if (record && record->holdsMemory()) {
            record->virtualSize = wholePages(record->virtualSize);
            found(*record);
        }
    }
    noteRefusal(descriptorsUnread, errno, memoryLeftOut);
    return true;
}

} // namespace tally::platform
