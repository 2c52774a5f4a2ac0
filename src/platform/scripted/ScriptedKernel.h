// ScriptedKernel: a kernel made of plain records that a test writes down.
//
// While one exists, every call of the platform's headers is answered from it, so the layers above run against
// what this machine does not have: shared library caches, submaps, purgeable memory, owned objects, corpses,
// refusals and races. It also records what was asked, so that a test can say what was not touched.
//
// Invariant: one kernel exists at a time. Answers may be asked from any thread and come one at a time; a test
// writes records before a gather begins, or during one from `before`.

#pragma once

#include "platform/clock.h"
#include "platform/mach_kernel_memory.h"
#include "platform/scripted/PlatformCalls.h"
#include "platform/scripted/ScriptedTask.h"

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

struct KernelState;

struct ScriptedKernelSymbol {
    std::uint64_t start = 0;
    std::uint64_t size = 0; // bytes
    std::string name{};
    std::optional<RKKernelSymbolicator::SourceInfo> source{};
};

class ScriptedKernel {
  public:
    /// Becomes the kernel that answers; stops the program when there is one.
    ScriptedKernel();
    ~ScriptedKernel();
    ScriptedKernel(const ScriptedKernel&) = delete;
    ScriptedKernel& operator=(const ScriptedKernel&) = delete;
    /// The kernel that answers; without one the program stops.
    static ScriptedKernel& current();

    // Processes.

    /// Starts a process. Where its pid is in use the process there ends, as when a pid is used again.
    ScriptedTask& addTask(TaskRecord record);
    /// The process of `pid`, zombie or not; null when there is none.
    ScriptedTask* findTask(std::int32_t pid) const;
    /// An id that no other object has, in 32 bits either.
    std::uint64_t makeObjectId();

    // Faults. `call` is the name of a platform call; the short identity record's is "proc_pidshortinfo".

    /// Makes the selected calls fail: with a status code where they return one, else with an errno value.
    /// Those that can only answer "none" do so. Throws std::invalid_argument for a call that does not exist
    /// or cannot fail.
    void fail(std::string_view call, int error, CallSelector which = {});
    /// Runs `action` before the selected calls are answered.
    void before(std::string_view call, std::function<void()> action, CallSelector which = {});
    /// Delivers a SIGINT. @return whether a source took it; without one the signal would have ended the
    /// program.
    bool interrupt();
    /// Delivers a SIGTERM. @return as interrupt() does.
    bool terminate();
    /// Lets the timer that is set fire as after `ticks` of its periods, and returns once its handler has run.
    /// @return false when there is none, or no longer.
    bool fireTimer(std::uint64_t ticks = 1);
    /// Waits until `call` has been made `count` times.
    void awaitCall(std::string_view call, std::uint64_t count = 1);

    // What was asked.

    const std::vector<CallRecord>& calls() const;
    std::size_t callCount(std::string_view name, std::optional<std::int32_t> pid = {}) const;
    /// References to ports that nobody has given up yet.
    std::size_t heldPortReferences() const;
    /// Buffers that nobody has given back yet.
    std::size_t heldBuffers() const;

    // The machine.

    std::uint64_t pageSize = 4096;                                  // bytes; set it before mappings are made
    std::uint32_t submapInfoCount = VM_REGION_SUBMAP_INFO_COUNT_64; // words that a region query fills
    std::optional<std::int32_t> selfRegionTally = 0; // the accounting switch; absent: there is none
    std::vector<std::string> ledgerTemplate = {"cpu_time", "phys_tally", "page_table"};
    std::uint64_t argmax = 262144; // bytes
    mach_times times{.absolute_ticks = 1'000'000,
                     .continuous_ticks = 2'000'000,
                     .wall_seconds = 1'700'000'000,
                     .wall_nanoseconds = 0}; // the first answer
    std::uint64_t ticksBetweenReadings = 1'000;
    mach_timebase timebase{.numer = 1, .denom = 1};
    std::uint64_t uptimeNanoseconds = 0;
    std::map<std::uint32_t, std::string> tagDescriptions; // of VM tags

    // The kernel's own memory.

    mach_memory_record memory;
    std::map<std::uint64_t, std::string> loadedModules; // identifiers by load tag
    std::optional<std::vector<ScriptedKernelSymbol>> kernelSymbols;

    // The tool's own process.

    std::int32_t ownPid = 99'000;
    std::uint32_t effectiveUserId = 0;
    bool outputIsTerminal = false;
    std::set<std::string, std::less<>> internalContent; // subsystems for which it is installed

    /// What the answers keep between calls; only they see into it.
    KernelState& state() { return *state_; }

  private:
    std::unique_ptr<KernelState> state_;
};

} // namespace tally::platform
