#include "platform/linux/tags/PresentMemory.h"

#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/Mapping.h"

#include <cerrno>
#include <utility>

namespace tally::platform {

namespace {

constexpr const char* memoryUnread = "Memory could not be looked into";
constexpr const char* unnamed = "what allocators hold is not told apart";

constexpr std::uint64_t pagemapPresent = std::uint64_t{1} << 63;

} // namespace

bool PresentMemory::open() {
    if (!isTried_) {
        isTried_ = true;
        for (const auto& [file, name] : {std::pair(&memory_, "/mem"), std::pair(&pagemap_, "/pagemap")}) {
            *file = openForReading(*folder_ + name);
            if (!file->isOpen()) {
                noteRefusal(memoryUnread, errno, unnamed);
            }
        }
    }
    return memory_.isOpen() && pagemap_.isOpen();
}

bool PresentMemory::read(std::uint64_t address, std::span<std::uint64_t> words, bool isPresent) {
    if (!open()) {
        return false;
    }
    std::uint64_t entry = pagemapPresent;
    errno = 0;
    const bool isKnown = isPresent || readExactly(pagemap_, address / basePage * sizeof entry,
                                                  std::as_writable_bytes(std::span(&entry, 1)));
    if (isKnown && (entry & pagemapPresent) == 0) {
        return false;
    }
    if (isKnown && readExactly(memory_, address, std::as_writable_bytes(words))) {
        return true;
    }
    if (errno != EIO) { // so the kernel tells of what was unmapped meanwhile
        noteRefusal(memoryUnread, errno, unnamed);
    }
    return false;
}

} // namespace tally::platform
