#include "platform/linux/images/LayoutTable.h"

#include "base/Format.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/objects/MapFiles.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <tuple>
#include <utility>

namespace tally::platform {

namespace {

/// What changes when a file does.
struct FileVersion {
    std::int64_t size = -1;
    std::int64_t seconds = 0; // of its last change
    std::int64_t nanoseconds = 0;

    bool operator==(const FileVersion&) const = default;
};

/// Absent on failure, with errno.
std::optional<FileVersion> versionOf(const Descriptor& file) {
    struct stat status {};
    if (fstat(file.number(), &status) != 0) {
        return std::nullopt;
    }
    return FileVersion{status.st_size, status.st_mtim.tv_sec, status.st_mtim.tv_nsec};
}

std::optional<FileVersion> versionOf(const FileAnswer& file) {
    return FileVersion{static_cast<std::int64_t>(file.status.stx_size), file.status.stx_mtime.tv_sec,
                       file.status.stx_mtime.tv_nsec};
}

/// Reads from the head of a file, which linkers put the headers into.
FileReader readerOf(const FileAnswer& file) {
    return [bytes = file.firstBytes()](std::uint64_t offset, std::span<std::byte> part) {
        const bool isThere = offset <= bytes.size() && part.size() <= bytes.size() - offset;
        if (isThere) {
            std::ranges::copy(bytes.subspan(offset, part.size()), part.begin());
        }
        return isThere;
    };
}

/// Reads from the file; `error` gets the errno of a read that fails.
FileReader readerOf(const Descriptor& file, int& error) {
    return [&](std::uint64_t offset, std::span<std::byte> part) {
        errno = 0;
        const bool isThere = readExactly(file, offset, part);
        error = isThere ? error : errno; // none where the file is shorter
        return isThere;
    };
}

/// Says why a file was not looked at.
void noteUnread(const Mapping& mapping, int error) {
    constexpr const char* consequence = "their segments are not told apart";
    if (error == ETIMEDOUT) {
        note(formatted("Files of device %u:%u were not looked at, it does not answer: %s",
                       mapping.deviceMajor, mapping.deviceMinor, consequence));
    } else {
        noteRefusal("Mapped files could not be read", error, consequence);
    }
}

/// One file. Its own lock is held while it is read, so that one slow file holds up no other.
struct FileEntry {
    std::mutex mutex;
    std::uint64_t gather = 0; // in which it was looked at last
    FileVersion version;
    std::shared_ptr<const ElfLayout> layout;
};

class LayoutTable {
  public:
    std::pair<std::shared_ptr<FileEntry>, std::uint64_t> entryFor(const BackingObject& object) {
        const std::scoped_lock lock(mutex_);
        std::shared_ptr<FileEntry>& entry = entries_[{object.device, object.inode}];
        if (!entry) {
            entry = std::make_shared<FileEntry>();
        }
        return {entry, gather_};
    }

    /// Files that the last gather met none of are forgotten.
    void beginGather() {
        const std::scoped_lock lock(mutex_);
        std::erase_if(entries_, [this](const auto& entry) { return entry.second->gather != gather_; });
        ++gather_;
    }

  private:
    std::mutex mutex_;
    std::uint64_t gather_ = 1;
    std::map<std::pair<std::uint64_t, std::uint64_t>, std::shared_ptr<FileEntry>> entries_; // device, inode
};

LayoutTable& layoutTable() {
    static LayoutTable table;
    return table;
}

} // namespace

std::shared_ptr<const ElfLayout> layoutOfFile(const BackingObject& object, const std::string& folder,
                                              const Mapping& mapping) {
    const auto [entry, gather] = layoutTable().entryFor(object);
    const std::scoped_lock lock(entry->mutex);
    if (entry->gather == gather) {
        return entry->layout;
    }
    const Descriptor file = openMappedFile(folder, mapping);
    const std::optional<FileAnswer> answer =
        file.isOpen() || errno != EAGAIN ? std::nullopt : inquireMappedFile(folder, mapping);
    const bool isFound = answer || file.isOpen();
    const std::optional<FileVersion> version = !isFound ? std::nullopt
                                               : answer ? versionOf(*answer)
                                                        : versionOf(file);
    if (!version) {
        noteUnread(mapping, errno);
        return nullptr; // another process may show it
    }
    if (*version != entry->version) {
        int error = 0;
        std::optional<ElfLayout> layout = readElfLayout(answer ? readerOf(*answer) : readerOf(file, error));
        if (error != 0) {
            noteUnread(mapping, error);
            return nullptr;
        }
        entry->layout = layout ? std::make_shared<const ElfLayout>(*std::move(layout)) : nullptr;
        entry->version = *version;
    }
    entry->gather = gather;
    return entry->layout;
}

void beginLayouts() { layoutTable().beginGather(); }

} // namespace tally::platform
