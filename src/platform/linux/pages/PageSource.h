// PageSource: the runs of present and swapped pages of one process, over a range of addresses.
//
// Reads by PAGEMAP_SCAN (6.7 and later), else what smaps finds anything in from pagemap. Both give the same
// runs.

#pragma once

#include "platform/linux/machine/MachineState.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/linux/pages/PageScan.h"
#include "platform/linux/pages/PageStates.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"
#include "platform/linux/pages/SmapsOfProcess.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>

namespace tally::platform {

/// Whether it matters where pages of private anonymous memory are, or only how many.
enum class PageDetail : std::uint8_t { counts, positions };

/// Pages of one state, side by side in one mapping.
struct FoundRun {
    std::size_t mapping = 0;
    std::uint64_t start = 0; // addresses
    std::uint64_t end = 0;
    PageKind kind = PageKind::object;
    bool isHuge = false; // mapped as whole huge pages
};

using PageRunSink = std::function<void(const FoundRun&)>;

/// Hands neighbouring pages of one state in one mapping on as a whole. `sink` must outlive it.
class RunJoiner {
  public:
    explicit RunJoiner(const PageRunSink& sink) : sink_(sink) {}
    RunJoiner(const RunJoiner&) = delete;
    RunJoiner& operator=(const RunJoiner&) = delete;
    ~RunJoiner() { finish(); }

    void add(std::size_t mapping, std::uint64_t address, PageKind kind) {
        if (run_.mapping != mapping || run_.end != address || run_.kind != kind) {
            finish();
            run_ = {mapping, address, address, kind};
        }
        run_.end += basePage;
    }

  private:
    void finish() {
        if (run_.end != run_.start) {
            sink_(run_);
        }
    }

    const PageRunSink& sink_;
    FoundRun run_;
};

/// How far mappings were read.
struct ScanCursor {
    std::uint64_t address = 0;
    std::size_t mapping = 0;      // the first that ends above it
    std::uint64_t mostMapped = 0; // mapped addresses that the next call may walk; 0 for the usual
    std::uint64_t callEnd = 0;    // where the next call ends

    void passTo(std::uint64_t to) { address = address < to ? to : address; }
};

/// Any number of threads may read at once.
class PageSource {
  public:
    PageSource(const ProcessMemoryFiles& files, std::span<const Mapping> mappings, SmapsOfProcess& smaps,
               PageDetail detail)
        : files_(files), mappings_(mappings), smaps_(smaps), detail_(detail) {}

    /// Reads the parts of mappings [first, end) that lie in the addresses [from, to), in rising order.
    /// @param reached out: the first mapping that was not read to its end or to `to`.
    /// @return 0 or an error: ESRCH when the task has ended.
    int read(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
             std::size_t* reached) const;
    /// Reads on from where `cursor` stands up to the end of mapping `end` - 1: one call of the kernel, or all
    /// of it where there is no such call. @param withFile as scanPages has it. @return as above.
    int readOn(std::size_t end, bool withFile, std::uint64_t mostPages, const PageRunSink& sink,
               ScanCursor* cursor) const;
    /// What a kind that a page table shows stands for on this machine; absent for no memory. Without swap,
    /// what shows as swapped are marks that userfaultfd left.
    std::optional<PageKind> memoryOf(std::optional<PageKind> kind) const {
        return kind == PageKind::swapped && !swapInUse_ ? std::nullopt : kind;
    }

  private:
    int scan(std::size_t first, std::size_t end, AddressRange window, bool withFile, const PageRunSink& sink,
             std::size_t* reached) const;
    int scanOn(std::size_t end, std::uint64_t last, bool withFile, std::uint64_t mostPages,
               const PageRunSink& sink, ScanCursor* cursor) const;
    int readOlder(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                  std::size_t* reached) const;
    bool isAlive() const;
    bool readPagemap(std::size_t index, AddressRange window, std::uint64_t expected,
                     const PageRunSink& sink) const;

    const ProcessMemoryFiles& files_;
    std::span<const Mapping> mappings_;
    SmapsOfProcess& smaps_;
    PageDetail detail_;
    bool swapInUse_ = machineState().swapInUse;
};

/// Reads the states of all `mappings`.
/// @return KERN_SUCCESS; KERN_INVALID_ARGUMENT when the task ended on the way: `states->mappings` then holds
/// the mappings that were read in full. A mapping whose states no source gives is marked unreadable.
kern_return_t readPageStates(PageSource& source, SmapsOfProcess& smaps, std::span<const Mapping> mappings,
                             PageStates* states);

} // namespace tally::platform
