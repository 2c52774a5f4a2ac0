#include "platform/linux/io/SystemFiles.h"

#include "platform/linux/io/Notes.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/resource.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <memory>

namespace tally::platform {

namespace {

std::string& systemRoot() {
    static std::string root;
    return root;
}

} // namespace

void setSystemRoot(std::string root) { systemRoot() = std::move(root); }

std::string systemPath(std::string_view path) {
    std::string full = systemRoot();
    full += path;
    return full;
}

std::string processFolder(std::int32_t pid) { return systemPath("/proc/" + std::to_string(pid)); }

Descriptor openForReading(const std::string& path) {
    return Descriptor(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
}

namespace {

/// Reads from `file` to its end and hands on each block as it comes. @return false on failure, with errno.
template <typename Take>
bool readBlocks(const Descriptor& file, const Take& take) {
    std::array<char, 16384> buffer; // the kernel's text files give a few KiB a read at most
    for (;;) {
        const ssize_t count = read(file.number(), buffer.data(), buffer.size());
        if (count > 0) {
            take(std::string_view(buffer.data(), static_cast<std::size_t>(count)));
        } else if (count == 0) {
            return true;
        } else if (errno != EINTR) {
            return false;
        }
    }
}

} // namespace

bool readToEnd(const Descriptor& file, std::string& text) {
    text.clear();
    return readBlocks(file, [&](std::string_view block) { text += block; });
}

bool readLines(const Descriptor& file, const std::function<void(std::string_view)>& take) {
    std::string begun; // the start of a line whose end has not come yet
    const bool isWhole = readBlocks(file, [&](std::string_view block) {
        const std::size_t end = block.rfind('\n') + 1; // 0 where no line ends
        if (end != 0) {
            begun += block.substr(0, end);
            take(begun);
            begun.clear();
        }
        begun += block.substr(end);
    });
    take(begun);
    return isWhole;
}

bool readExactly(const Descriptor& file, std::uint64_t offset, std::span<std::byte> bytes) {
    return pread(file.number(), bytes.data(), bytes.size(), static_cast<off_t>(offset)) ==
           static_cast<ssize_t>(bytes.size());
}

std::optional<std::string> readSystemFile(const std::string& path) {
    const Descriptor file = openForReading(path);
    std::string text;
    if (!file.isOpen() || !readToEnd(file, text)) {
        return std::nullopt;
    }
    return text;
}

namespace {

std::optional<std::string> readRecordOnce(const std::string& path) {
    const Descriptor file = openForReading(path);
    std::array<char, 16384> buffer;
    ssize_t count = -1;
    do {
        count = file.isOpen() ? read(file.number(), buffer.data(), buffer.size()) : -1;
    } while (count < 0 && errno == EINTR);
    if (count < 0) {
        return std::nullopt;
    }
    std::string text(buffer.data(), static_cast<std::size_t>(count));
    std::string rest;
    if (text.size() == buffer.size() && readToEnd(file, rest)) {
        text += rest;
    }
    return text;
}

} // namespace

std::optional<std::string> readSystemRecord(const std::string& path) {
    std::optional<std::string> text = readRecordOnce(path);
    // What there is none of stays so; other threads can hold all descriptors, or the memory, for a moment.
    return text || !isRefusal(errno) ? text : readRecordOnce(path);
}

void allowDescriptors(std::size_t count) {
    constexpr rlim_t usual = 128;
    rlimit limit{};
    if (getrlimit(RLIMIT_NOFILE, &limit) == 0 && limit.rlim_cur < count + usual) {
        const rlim_t most = limit.rlim_max;
        limit.rlim_cur = count + usual;
        limit.rlim_max = std::max(most, limit.rlim_cur);
        if (setrlimit(RLIMIT_NOFILE, &limit) != 0) { // only root may go beyond the hard limit
            limit = {std::min(limit.rlim_cur, most), most};
            setrlimit(RLIMIT_NOFILE, &limit);
        }
    }
}

std::optional<std::string> readSystemLink(const std::string& path) {
    std::string target(256, '\0');
    for (;;) {
        const ssize_t length = readlink(path.c_str(), target.data(), target.size());
        if (length < 0) {
            return std::nullopt;
        }
        if (static_cast<std::size_t>(length) < target.size()) {
            target.resize(static_cast<std::size_t>(length));
            return target;
        }
        if (target.size() >= 65536) {
            errno = ENAMETOOLONG;
            return std::nullopt;
        }
        target.resize(target.size() * 2);
    }
}

std::optional<std::vector<std::int32_t>> listNumbered(const std::string& path) {
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(path.c_str()), closedir);
    if (!folder) {
        return std::nullopt;
    }
    std::vector<std::int32_t> numbers;
    errno = 0; // by which a failure differs from the end
    while (const dirent* entry = readdir(folder.get())) {
        const char* const end = entry->d_name + std::strlen(entry->d_name);
        std::int32_t number = 0;
        const auto result = std::from_chars(entry->d_name, end, number);
        if (result.ec == std::errc() && result.ptr == end) {
            numbers.push_back(number);
        }
    }
    if (errno != 0) {
        return std::nullopt;
    }
    std::sort(numbers.begin(), numbers.end());
    return numbers;
}

} // namespace tally::platform
