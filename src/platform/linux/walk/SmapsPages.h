// Page counts from smaps, for what cheaper sources cannot tell and for kernels that have none.

#pragma once

#include "platform/kern_return.h"
#include "platform/linux/walk/DecodeMaps.h"
#include "platform/linux/walk/PageStates.h"
#include "platform/linux/walk/ProcessMemoryFiles.h"

#include <optional>
#include <span>
#include <vector>

namespace tally::platform {

/// The smaps of one process, read when first asked for.
class SmapsOfProcess {
  public:
    explicit SmapsOfProcess(const ProcessMemoryFiles& files) : files_(&files) {}

    /// The entry of the mapping that starts where `mapping` does; null when there is none or smaps cannot be
    /// read.
    const SmapsEntry* entryFor(const Mapping& mapping);
    /// Whether smaps could be read and has entries.
    bool isReadable();

  private:
    const ProcessMemoryFiles* files_;
    std::optional<std::vector<SmapsEntry>> entries_;
};

/// Fills the states of the mappings that have none yet or are marked unreadable: private anonymous memory
/// from smaps alone, the rest, where smaps finds pages, from pagemap.
/// @return KERN_SUCCESS; KERN_INVALID_ARGUMENT when the task has ended.
kern_return_t readPagesBySmaps(const ProcessMemoryFiles& files, std::span<const Mapping> mappings,
                               SmapsOfProcess& smaps, PageStates* states);

} // namespace tally::platform
