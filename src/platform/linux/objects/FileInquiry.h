// Questions to files that may never answer, because a program or a server on the network stands behind them.
//
// Whoever asks such a file waits in the kernel, and cannot always be made to give up: not even a process ends
// one of whose threads waits so. So a process of its own asks, and is left to itself when it is late. One at
// a time per device; a device that was late once is asked no more in this run. Thread-safe.

#pragma once

#include <sys/stat.h>

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>

namespace tally::platform {

struct FileAnswer {
    int error = 0; // of the question, else 0
    struct statx status {};
    std::uint64_t fileSystemType = 0; // as statfs gives it
    std::uint32_t headLength = 0;     // bytes
    std::array<std::byte, 4096> head; // the first bytes of a regular file

    std::span<const std::byte> firstBytes() const { return std::span(head).first(headLength); }
};

/// The key of files whose device is not known.
inline constexpr std::uint64_t unknownDevice = ~std::uint64_t{0};

/// What stat tells, for where statx is refused. Waits for who stands behind the file. @return false with
/// errno.
bool statusByOlderCall(const char* path, struct statx& status);

/// Asks what is at `path`. @param device that is believed to be behind it.
/// @return absent with errno: ETIMEDOUT when no answer came within a second or before, or what the file
/// system says.
std::optional<FileAnswer> inquire(std::uint64_t device, const std::string& path);

/// Whether `pid` is one of the processes that ask, which are no targets.
bool isInquirer(std::int32_t pid);

/// Ends the processes that ask; the next question begins new ones.
void endInquiries();

} // namespace tally::platform
