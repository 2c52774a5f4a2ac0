// PageSource: the runs of present and swapped pages of one process, over a range of addresses.
//
// Reads by PAGEMAP_SCAN (6.7 and later), else what smaps finds anything in from pagemap. Both give the same
// runs.

#pragma once

#include "platform/linux/gather/MachineState.h"
#include "platform/linux/walk/Mapping.h"
#include "platform/linux/walk/PageScan.h"
#include "platform/linux/walk/PageStates.h"
#include "platform/linux/walk/ProcessMemoryFiles.h"
#include "platform/linux/walk/SmapsOfProcess.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>

namespace tally::platform {

/// Whether it matters where pages of private anonymous memory are, or only how many.
enum class PageDetail : std::uint8_t { counts, positions };

/// Takes the run [start, end) of addresses, which lies in mapping `index`.
using PageRunSink =
    std::function<void(std::size_t index, std::uint64_t start, std::uint64_t end, PageKind kind)>;

class PageSource {
  public:
    PageSource(const ProcessMemoryFiles& files, std::span<const Mapping> mappings, SmapsOfProcess& smaps,
               PageDetail detail)
        : files_(files), mappings_(mappings), smaps_(smaps), detail_(detail) {}

    /// Reads the parts of mappings [first, end) that lie in the addresses [from, to), in rising order.
    /// @param reached out: the first mapping that was not read to its end or to `to`.
    /// @return 0 or an error: ESRCH when the task has ended.
    int read(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
             std::size_t* reached);

  private:
    int scan(std::size_t first, std::size_t end, AddressRange window, bool withFile, const PageRunSink& sink,
             std::size_t* reached);
    int readOlder(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                  std::size_t* reached);
    std::optional<PageKind> memoryOf(std::optional<PageKind> kind) const;
    bool isAlive() const;
    bool readPagemap(std::size_t index, AddressRange window, const PageRunSink& sink);

    const ProcessMemoryFiles& files_;
    std::span<const Mapping> mappings_;
    SmapsOfProcess& smaps_;
    PageDetail detail_;
    bool swapInUse_ = machineState().swapInUse;
    std::array<PageRegion, 512> room_;
};

} // namespace tally::platform
