// TLTally: one measurement, from its targets to its report.
//
// Gathered once on all processors; analysed and reported on one thread. Regions belong to their processes,
// objects to the tables until the report has grouped the processes, then to the groups.

#pragma once

#include "analysis/TLMemoryCategory.h"
#include "analysis/TLProcessGroup.h"
#include "base/IntegerTable.h"
#include "platform/dispatch.h"
#include "process/TLProcess.h"
#include "report/TLOutputFormatter.h"
#include "report/TLTime.h"

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <memory_resource>
#include <optional>
#include <unordered_map>
#include <vector>

namespace tally {

class TLTally {
  public:
    using ProcessList = std::vector<std::shared_ptr<TLProcess>>;
    using ObjectTable =
        std::pmr::unordered_map<std::uint64_t, std::shared_ptr<TLMemoryObject>, IntegerKeyHash>;

    explicit TLTally(ProcessList processes) : processes_(std::move(processes)) {}
    TLTally(const TLTally&) = delete;
    TLTally& operator=(const TLTally&) = delete;

    // Gathering (defined in cli/Gathering.cpp).

    /// Gathers every process, highest pid first, on all processors. @return whether it was interrupted.
    bool gatherAllProcesses();
    /// A started source that runs `handler` on every SIGINT, or other signal of `signals`; the caller cancels
    /// it.
    static std::unique_ptr<platform::SignalSource>
    installSigintHandler(std::function<void()> handler,
                         platform::InterruptSignals signals = platform::InterruptSignals::sigint);
    /// The accounting switch (vm/PhysTallyCollection.h).
    static bool physTallyCollectionEnabled();
    static void setPhysTallyCollectionEnabled(int value);

    // Analysis.

    /// Files every region of every process under its memory object and computes the totals.
    void analyzeMemoryObjects();

    // Report.

    void addOutputFormatter(std::shared_ptr<TLOutputFormatter> formatter) {
        outputFormatters_.push_back(std::move(formatter));
    }
    /// The processes that are not hidden, in list order.
    ProcessList displayedProcesses() const;
    /// Drives every formatter through the whole report. analyzeMemoryObjects must have run since the last
    /// one.
    void printReport(bool regionlistLikeOutput, bool summarize);
    /// Whether `a` is shown before `b`: by total, then by pid, the larger first.
    bool compareProcessesForDisplay(const TLProcess& a, const TLProcess& b) const;

    const ProcessList& processes() const { return processes_; }
    const std::map<std::int32_t, std::uint64_t>& pidToTally() const { return pidToTally_; }
    const std::optional<TLTime>& gatherStartTime() const { return gatherStartTime_; }
    const std::optional<TLTime>& gatherEndTime() const { return gatherEndTime_; }

    std::atomic<bool> earlyExit = false; // only ever set to true, by the interrupt handler
    std::uint32_t qualityOfService = platform::QOS_CLASS_UTILITY;
    /// One of several measurements, which can hand a process on from one to the next while it is reported.
    bool isSample = false;

  private:
    struct MemoryObjectTables {
        using Arena = std::pmr::monotonic_buffer_resource;

        std::unique_ptr<Arena> nodes = std::make_unique<Arena>(); // of the tables: goes when they go
        std::pmr::memory_resource* objects;                       // outlives the tables
        ObjectTable memoryObjects{nodes.get()};
        std::map<platform::uuid_t, ObjectTable> sharedCacheMemoryObjects;
        ObjectTable textMemoryObjects{nodes.get()};
        ObjectTable linkeditMemoryObjects{nodes.get()};
        std::vector<std::shared_ptr<TLMemoryObject>> uniqueMemoryObjects; // no two regions share one of them

        explicit MemoryObjectTables(std::pmr::memory_resource* resource) : objects(resource) {}

        /// The object that `region` shows, made when it is the first to show it.
        TLMemoryObject& objectForRegion(const TLMemoryRegion& region, const TLProcess& process,
                                        ObjectTable* sharedCacheTable);
        std::shared_ptr<TLMemoryObject> makeObject() const;
        void finalizeSizes();
    };

    /// The process's entry of pidToTally.
    std::optional<std::uint64_t> totalOf(const TLProcess& process) const;

    ProcessList processes_;                            // never changes
    std::map<std::int32_t, std::uint64_t> pidToTally_; // bytes, of the displayed processes
    // Objects are made by the ten thousand and go together: they live here, and none may outlive its tally.
    std::unique_ptr<std::pmr::monotonic_buffer_resource> arena_;
    std::optional<MemoryObjectTables> tables_; // from the analysis to the grouping
    /// What the objects took from the regions of a sample, for the next one's analysis.
    std::vector<std::pair<TLMemoryRegion*, std::unique_ptr<TLRangeList>>> takenSubranges_;
    std::vector<std::shared_ptr<TLOutputFormatter>> outputFormatters_;
    std::optional<TLTime> gatherStartTime_;
    std::optional<TLTime> gatherEndTime_;
};

} // namespace tally
