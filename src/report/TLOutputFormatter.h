// TLOutputFormatter: what a report calls and every output format implements.
//
// The calls of one report, in this order. Each goes to every formatter before the next one does.
//
//   startAtTime
//   printRegionlistLikeOutputForProcess     for every process, where regions are listed
//   for every process
//       printProcessHeader
//       printProcessTotal                   not with errors
//       endProcessHeader
//       printProcessCategories              its own; with errors, or in no group, with nothing
//       printSharedCategories               once for each group that it shares memory with
//       printProcessAuxData
//   printProcessesWithWarnings, printSummaryCategories, printGlobalAuxData
//   endAtTime
//
// A sampling run begins with configureForMultipleOutputs. Every run ends with close, or with discard where
// nothing is to stay. Calls come from one thread at a time; arguments are valid during the call only.

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace tally {

class TLMemoryCategory;
class TLProcess;
class TLProcessGroup;
class TLTime;
struct TLAuxDictionary;
struct TLMemoryRegion;
struct TLMemoryTotals;

class TLOutputFormatter {
  public:
    using Categories = std::map<std::string, TLMemoryCategory, std::less<>>;
    using Processes = std::vector<std::shared_ptr<TLProcess>>;

    virtual ~TLOutputFormatter() = default;

    virtual void printProcessHeader(const TLProcess& process) = 0;
    virtual void endProcessHeader(const TLProcess& process) = 0;
    /// @param total bytes the process is charged for, dirty and swapped; may be absent.
    virtual void printProcessTotal(std::optional<std::uint64_t> total, const TLProcess& process) = 0;
    virtual void printProcessCategories(const Categories& categories, const TLMemoryTotals& total) = 0;
    /// Memory that `process` shares with exactly the processes of `sharedWith`.
    /// @param hasProcessView whether the sizes are this process's own view.
    virtual void printSharedCategories(const Categories& categories, const TLProcessGroup& sharedWith,
                                       const TLProcess& process, bool hasProcessView,
                                       const TLMemoryTotals& total) = 0;
    /// Ends the process's section; `auxData` may be absent.
    virtual void printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) = 0;
    virtual void printProcessesWithWarnings(const Processes& processesWithWarnings,
                                            const Processes& processesWithErrors,
                                            const std::vector<std::string>& globalErrors) = 0;
    virtual void printSummaryCategories(const Categories& categories, const TLMemoryTotals& total,
                                        bool hadErrors) = 0;
    virtual void printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) = 0;
    /// The report is complete; `time` is when gathering ended.
    virtual void endAtTime(const std::optional<TLTime>& time) = 0;

    // Optional operations: a formatter that implements one says so.

    /// The class's name, for messages.
    virtual const char* className() const = 0;
    /// A report begins; `time` is when gathering began.
    virtual void startAtTime(const std::optional<TLTime>& /*time*/) {}
    virtual bool supportsMultipleOutputs() const { return false; }
    virtual void configureForMultipleOutputs() {}
    /// No report follows: finishes the output. @return 0, or the errno for which something is missing in it.
    virtual int close() { return 0; }
    /// There is no report: an earlier output that this formatter would replace by an empty one is left alone.
    virtual void spareEarlier() {}
    /// The run has failed before its first report: removes an output that this formatter created.
    virtual void discard() {}
    virtual bool supportsRegionlistLikeOutput() const { return false; }
    virtual void printRegionlistLikeOutputForProcess(const TLProcess& /*process*/,
                                                     std::span<const TLMemoryRegion> /*regions*/) {}
};

} // namespace tally
