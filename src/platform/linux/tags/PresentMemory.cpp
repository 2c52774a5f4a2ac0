#include "platform/linux/tags/PresentMemory.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/walk/Mapping.h"

namespace tally::platform {

namespace {

constexpr std::uint64_t pagemapPresent = std::uint64_t{1} << 63;

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
           readExactly(pagemap_, address / basePage * sizeof entry,
                       std::as_writable_bytes(std::span(&entry, 1))) &&
           (entry & pagemapPresent) != 0 && readExactly(memory_, address, std::as_writable_bytes(words));
}

} // namespace tally::platform
