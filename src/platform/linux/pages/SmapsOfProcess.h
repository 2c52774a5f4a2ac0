// SmapsOfProcess: page counts from smaps, for what cheaper sources cannot tell and for kernels that have
// none.

#pragma once

#include "platform/linux/pages/DecodeMaps.h"

#include <mutex>
#include <string>
#include <utility>
#include <vector>

namespace tally::platform {

/// The smaps of one process, read when first asked for. Any number of threads may ask.
class SmapsOfProcess {
  public:
    /// @param folder of the process.
    explicit SmapsOfProcess(std::string folder) : folder_(std::move(folder)) {}

    /// The entry of the mapping that starts where `mapping` does; null when there is none or smaps cannot be
    /// read.
    const SmapsEntry* entryFor(const Mapping& mapping);
    /// Whether smaps could be read and has entries.
    bool isReadable();
    /// Whether it was asked for and could not be read. No other thread may ask meanwhile.
    bool wasMissed() const { return isMissed_; }

  private:
    std::string folder_;
    std::once_flag isRead_;
    bool isMissed_ = false;
    std::vector<SmapsEntry> entries_;
};

} // namespace tally::platform
