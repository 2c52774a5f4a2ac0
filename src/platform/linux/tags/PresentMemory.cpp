#include "platform/linux/tags/PresentMemory.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/walk/Mapping.h"

#include <unistd.h>

namespace tally::platform {

namespace {

constexpr std::uint64_t pagemapPresent = std::uint64_t{1} << 63;

template <typename Word>
bool readExactly(const Descriptor& file, std::uint64_t offset, std::span<Word> words) {
    return pread(file.number(), words.data(), words.size_bytes(), static_cast<off_t>(offset)) ==
           static_cast<ssize_t>(words.size_bytes());
}

} // namespace

bool PresentMemory::open() {
    if (!isTried_) {
        isTried_ = true;
        memory_ = openForReading(*folder_ + "/mem");
        pagemap_ = openForReading(*folder_ + "/pagemap");
    }
    return memory_.isOpen() && pagemap_.isOpen();
}

bool PresentMemory::read(std::uint64_t address, std::span<std::uint64_t> words) {
    std::uint64_t entry = 0;
    return open() &&
           readExactly(pagemap_, address / basePage * sizeof entry, std::span<std::uint64_t>(&entry, 1)) &&
           (entry & pagemapPresent) != 0 && readExactly(memory_, address, words);
}

} // namespace tally::platform
