// Output files: written through a descriptor, known by device and inode.

#include "platform/output_file.h"

#include "platform/linux/io/Descriptor.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <system_error>
#include <utility>

namespace tally::platform {

namespace {

bool isSameFile(const struct stat& a, const struct stat& b) {
    return a.st_dev == b.st_dev && a.st_ino == b.st_ino;
}

/// Writes all of `bytes`. @return 0 or errno.
int writeAll(int descriptor, std::string_view bytes) {
    while (!bytes.empty()) {
        const ssize_t count = ::write(descriptor, bytes.data(), bytes.size());
        if (count < 0 && errno != EINTR) {
            return errno;
        }
        bytes.remove_prefix(static_cast<std::size_t>(std::max<ssize_t>(count, 0)));
    }
    return 0;
}

class DescriptorFile : public OutputFile {
  public:
    explicit DescriptorFile(Descriptor descriptor) : descriptor_(std::move(descriptor)) {}

    void write(std::string_view bytes) override {
        if (error_ != 0) {
            return;
        }
        error_ = writeAll(descriptor_.number(), bytes);
        if (error_ == 0) {
            length_ += static_cast<off_t>(bytes.size());
        } else {
            // A part of the bytes may be there. What is no regular file cannot take it back.
            [[maybe_unused]] const int cut = ftruncate(descriptor_.number(), length_);
        }
    }

  protected:
    Descriptor descriptor_;
    int error_ = 0;
    off_t length_ = 0; // bytes written
};

class NamedFile final : public DescriptorFile {
  public:
    /// @param madeAt where this run has made the file; empty when it was there before.
    NamedFile(Descriptor descriptor, std::string madeAt)
        : DescriptorFile(std::move(descriptor)), madeAt_(std::move(madeAt)) {
        fstat(descriptor_.number(), &status_);
    }

    void write(std::string_view bytes) override {
        if (isSpared_) {
            return;
        }
        if (!std::exchange(isEmptied_, true) && S_ISREG(status_.st_mode) &&
            ftruncate(descriptor_.number(), 0) != 0) {
            error_ = errno;
        }
        DescriptorFile::write(bytes);
    }

    int close() override {
        // A file system on another machine may tell only now that there was no room.
        const int failed = ::close(descriptor_.release()) != 0 && errno != EINTR ? errno : 0;
        return error_ != 0 ? error_ : failed;
    }

    void spareEarlier() override {
        isSpared_ = madeAt_.empty() && !isEmptied_ && S_ISREG(status_.st_mode) && status_.st_size != 0;
    }

    void discard() override {
        struct stat found {};
        if (!madeAt_.empty() && lstat(madeAt_.c_str(), &found) == 0 && isSameFile(status_, found)) {
            unlink(madeAt_.c_str());
        }
    }

  private:
    std::string madeAt_;
    struct stat status_ {};
    bool isEmptied_ = false;
    bool isSpared_ = false;
};

/// Keeps the document in a file without a name until the standard output is complete.
class FollowingFile final : public DescriptorFile {
  public:
    using DescriptorFile::DescriptorFile;

    int close() override {
        std::fflush(stdout);
        std::array<char, 65536> buffer;
        for (off_t at = 0; error_ == 0 && at < length_;) {
            const ssize_t count = pread(descriptor_.number(), buffer.data(), buffer.size(), at);
            if (count <= 0) {
                error_ = count < 0 ? errno : EIO;
                break;
            }
            error_ = writeAll(STDOUT_FILENO, {buffer.data(), static_cast<std::size_t>(count)});
            at += count;
        }
        return error_;
    }

    void discard() override {}
};

std::string withoutLinks(const std::string& path) {
    std::error_code ignored;
    return std::filesystem::canonical(path, ignored);
}

Descriptor openUnnamedFile() {
    const std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::tmpfile(), std::fclose);
    return Descriptor(file ? fcntl(fileno(file.get()), F_DUPFD_CLOEXEC, 0) : -1);
}

} // namespace

std::unique_ptr<OutputFile> OutputFile::open(const std::string& path) {
    struct stat there {};
    struct stat output {};
    if (stat(path.c_str(), &there) == 0 && fstat(STDOUT_FILENO, &output) == 0 && isSameFile(there, output)) {
        Descriptor aside = openUnnamedFile();
        return aside.isOpen() ? std::make_unique<FollowingFile>(std::move(aside)) : nullptr;
    }
    // Not for reading too: a FIFO would be opened before there is a reader, and what is in it then is lost.
    constexpr int flags = O_WRONLY | O_CREAT | O_CLOEXEC | O_NOCTTY;
    Descriptor file(::open(path.c_str(), flags | O_EXCL, 0666));
    bool isMade = file.isOpen();
    if (!isMade && errno == EEXIST) {
        isMade = stat(path.c_str(), &there) != 0 && errno == ENOENT; // a link to nothing yet
        file = Descriptor(::open(path.c_str(), flags, 0666));
    }
    return file.isOpen() ? std::make_unique<NamedFile>(std::move(file), isMade ? withoutLinks(path) : "")
                         : nullptr;
}

bool isOneFile(const std::string& a, const std::string& b) {
    struct stat first {};
    struct stat second {};
    return stat(a.c_str(), &first) == 0 && stat(b.c_str(), &second) == 0 && isSameFile(first, second) &&
           !S_ISCHR(first.st_mode);
}

} // namespace tally::platform
