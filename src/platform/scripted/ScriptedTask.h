// ScriptedTask: one process of the scripted kernel, with everything that can be asked about it.
//
// Records are written with designated initialisers; every member has a default that makes the ordinary case.
// A test may change members at any time before a gather, and during one from ScriptedKernel::before.

#pragma once

#include "platform/View.h"
#include "platform/bsd_process.h"
#include "platform/dyld_inspection.h"
#include "platform/gather.h"
#include "platform/kern_return.h"
#include "platform/mach_vm.h"
#include "platform/runekit.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace tally::platform {

/// What the kernel counts in one mapping; in pages.
struct PageCounts {
    std::uint32_t resident = 0;
    std::uint32_t dirtied = 0;
    std::uint32_t reusable = 0;
    std::uint32_t swapped = 0;
    std::uint32_t sharedNowPrivate = 0;
};

/// The pages of a mapping: a letter each, from its first page on. Pages without a letter are absent.
///   .  absent
///   D  present and dirty
///   C  present and clean
///   A  present and anonymous: never of the file, though not marked dirty
///   R  present and reusable
///   S  paged out
/// Present pages of a mapping with an external pager are of the file, but for A.
struct PageStates {
    std::string letters{};
    std::vector<std::int32_t> words{}; // raw dispositions; they take the place of the letters
    /// What the mapping's counts say where that is not what the pages say. Without pages some are made that
    /// agree with it.
    std::optional<PageCounts> counts{};

    PageStates() = default;
    PageStates(const char* pages) : letters(pages) {}            // NOLINT(google-explicit-constructor)
    PageStates(std::string pages) : letters(std::move(pages)) {} // NOLINT(google-explicit-constructor)
    PageStates(PageCounts exactly) : counts(exactly) {}          // NOLINT(google-explicit-constructor)
    PageStates(std::vector<std::int32_t> dispositions)           // NOLINT(google-explicit-constructor)
        : words(std::move(dispositions)) {}
    PageStates(std::string pages, PageCounts told) : letters(std::move(pages)), counts(told) {}

    /// The pages that are told.
    std::size_t length() const {
        const std::size_t told = words.empty() ? letters.size() : words.size();
        return told == 0 && counts ? std::size_t{counts->resident} + counts->swapped : told;
    }
};

/// One mapping. Sizes and addresses are bytes.
struct ScriptedMapping {
    std::optional<std::uint64_t> start{};    // absent: where the mapping before it ends
    std::uint64_t size = 0;                  // 0: as many pages as are given, or the nested mappings' extent
    std::uint32_t tag = 0;                   // VM user tag
    PageStates pages{};                      // as charged to the task
    std::optional<PageStates> objectPages{}; // as the VM object sees them; absent: the same
    std::optional<std::uint64_t> object{};   // full id; absent: an object of its own; 0: none
    std::uint64_t offset = 0;                // of the first byte in the object
    std::optional<std::uint8_t> shareMode{}; // absent: shared with an `object` that is given, else private
    std::uint32_t refCount = 1;              // mappings of the object
    std::uint16_t shadowDepth = 0;           // objects below it
    std::string file{};                      // name of the file behind it
    std::optional<bool> externalPager{};     // absent: exactly when there is a file
    int purgeable = VM_PURGABLE_DENY;        // VM_PURGABLE_...
    kern_return_t purgeableStatus = 0;       // an error: the state cannot be read
    std::uint16_t wiredCount = 0;            // by its user
    std::int32_t protection = 3;             // VM_PROT bits
    std::int32_t maxProtection = 7;          // VM_PROT bits
    std::int32_t behavior = 0;               // how it is paged
    std::uint32_t inheritance = 1;           // 1: copied by a fork
    std::vector<ScriptedMapping> nested{};   // what a submap holds, at absolute addresses; empty: no submap

    std::uint64_t end() const { return start.value_or(0) + size; }
    bool hasExternalPager() const { return externalPager.value_or(!file.empty()); }
};

enum class TaskState { alive, zombie, gone };

struct TaskRecord {
    std::int32_t pid = 0;
    std::int32_t parent = 1;
    std::string name{};                // process name; the record takes its first 32 bytes
    std::optional<std::string> comm{}; // command name; absent: the name. The record takes its first 16 bytes
    std::uint32_t flags = PROC_FLAG_LP64;
    TaskState state = TaskState::alive;

    std::string path{};                           // of the executable; empty: "/bin/<name>"
    std::vector<std::string> arguments{};         // the area's arguments
    std::optional<std::string> argumentArea{};    // raw bytes in place of path and arguments
    kern_return_t portStatus = 0;                 // what asking for the task port answers
    kern_return_t corpseStatus = 0;               // what asking for a corpse answers
    std::vector<std::byte> crashInformation{};    // of its corpses: a kcdata buffer
    std::uint32_t dirtyFlags = 0;                 // PROC_DIRTY_...
    rusage_info_v5 usage{};                       // bytes
    std::map<std::string, std::int64_t> ledger{}; // balances by entry name; the others are 0
    std::optional<std::vector<owned_vmobject>> owned{std::in_place}; // absent: the kernel has no such list
    std::vector<RKSymbolOwner> images{};
    std::map<std::string, std::string> resolvedPaths{}; // symbolic links, as the task sees them
    std::optional<dyld_shared_cache> sharedCache{};
    kern_return_t cacheProcessStatus = 0;
    kern_return_t cacheSnapshotStatus = 0;
    task_notices notices{};  // what the platform has to say about its figures
    std::int32_t family = 0; // processes of one family are relatives; 0: none
};

class ScriptedTask : public TaskRecord {
  public:
    /// @param pageSize the kernel's. @param makeObjectId gives ids that no other object has.
    ScriptedTask(const std::uint64_t& pageSize, std::function<std::uint64_t()> makeObjectId,
                 TaskRecord record)
        : TaskRecord(std::move(record)), pageSize_(&pageSize), makeObjectId_(std::move(makeObjectId)) {}

    /// Adds a mapping. @return the mapping, which stays where it is and may be changed.
    /// Throws std::invalid_argument when it is empty, not of whole pages or overlaps another one.
    ScriptedMapping& map(ScriptedMapping mapping);
    /// Takes away the mapping that begins at `start`.
    void unmap(std::uint64_t start) { mappings_.erase(start); }
    void becomeZombie() { state = TaskState::zombie; }
    void exit() { state = TaskState::gone; }

    /// A mapping as a walk meets it. `mapping` is null past the last one.
    struct Place {
        const ScriptedMapping* mapping = nullptr;
        std::uint32_t depth = 0; // submaps around it
    };
    /// The first mapping that ends above `address`, descending into at most `depth` submaps.
    Place findMapping(std::uint64_t address, std::uint32_t depth) const;

  private:
    void settle(ScriptedMapping& mapping, std::uint64_t previousEnd);

    const std::uint64_t* pageSize_;
    std::function<std::uint64_t()> makeObjectId_;
    std::map<std::uint64_t, ScriptedMapping> mappings_; // by start
};

/// The disposition word of page `index` of `mapping`.
std::int32_t pageWord(const ScriptedMapping& mapping, View view, std::size_t index);

/// What the kernel counts in `mapping`.
PageCounts pageCounts(const ScriptedMapping& mapping, View view);

} // namespace tally::platform
