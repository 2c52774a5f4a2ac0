// SmapsOfProcess: page counts from smaps, for what cheaper sources cannot tell and for kernels that have
// none.

#pragma once

#include "platform/linux/walk/DecodeMaps.h"

#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace tally::platform {

/// The smaps of one process, read when first asked for.
class SmapsOfProcess {
  public:
    /// @param folder of the process.
    explicit SmapsOfProcess(std::string folder) : folder_(std::move(folder)) {}

    /// The entry of the mapping that starts where `mapping` does; null when there is none or smaps cannot be
    /// read.
    const SmapsEntry* entryFor(const Mapping& mapping);
    /// Whether smaps could be read and has entries.
    bool isReadable();

  private:
    std::string folder_;
    std::optional<std::vector<SmapsEntry>> entries_;
};

} // namespace tally::platform
