// PresentMemory: words of another process's memory, read without changing it.
//
// Only pages that are present are read: any other would be brought in for the process. Reading through the
// memory file leaves pages that are shared after a fork shared. One thread.

#pragma once

#include "platform/linux/io/Descriptor.h"

#include <cstdint>
#include <span>
#include <string>

namespace tally::platform {

class PresentMemory {
  public:
    /// @param folder the process folder; its files are opened by the first read.
    explicit PresentMemory(const std::string& folder) : folder_(&folder) {}

    /// Reads `words` from `address` on; they lie in one page. @param isPresent whether the page is known to
    /// be.
    /// @return false when the page is not present or may not be read.
    bool read(std::uint64_t address, std::span<std::uint64_t> words, bool isPresent);

  private:
    bool open();

    const std::string* folder_;
    bool isTried_ = false;
    Descriptor pagemap_;
    Descriptor memory_;
};

} // namespace tally::platform
