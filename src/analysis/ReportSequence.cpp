// Report sequence: the one operation that produces output.
//
// Decides what is counted where and in which order it is told; the formatters only render. Every step goes to
// every formatter in list order.

#include "analysis/ProcessGrouping.h"
#include "analysis/TLTally.h"
#include "base/Assertion.h"

#include <algorithm>

namespace tally {

namespace {

using Formatters = std::vector<std::shared_ptr<TLOutputFormatter>>;

/// What is collected over the processes of a report and told after them.
struct Findings {
    TLTally::ProcessList processesWithWarnings;
    TLTally::ProcessList processesWithErrors;
    std::vector<std::string> globalErrors;
    std::optional<TLAuxDictionary> globalAuxData;

    void add(const std::shared_ptr<TLProcess>& process, const std::optional<TLAuxDictionary>& auxData) {
        if (!process->warnings().empty()) {
            processesWithWarnings.push_back(process);
        }
        if (process->hasErrors()) {
            processesWithErrors.push_back(process);
        } else if (auxData) {
            globalAuxData = auxData->mergeWithData(globalAuxData);
        }
        globalErrors.insert(globalErrors.end(), process->globalErrors().begin(),
                            process->globalErrors().end());
    }
    bool hadErrors() const { return !globalErrors.empty() || !processesWithErrors.empty(); }
};

void printRegionLists(const Formatters& formatters, const TLTally::ProcessList& processes) {
    for (const auto& process : processes) {
        for (const auto& formatter : formatters) {
            if (formatter->supportsRegionlistLikeOutput()) {
                formatter->printRegionlistLikeOutputForProcess(*process, process->memoryRegions());
            }
        }
    }
}

void printHeader(const Formatters& formatters, const TLProcess& process, std::optional<std::uint64_t> total) {
    for (const auto& formatter : formatters) {
        formatter->printProcessHeader(process);
        if (!process.hasErrors()) {
            formatter->printProcessTotal(total, process);
        }
        formatter->endProcessHeader(process);
    }
}

void printCategories(const Formatters& formatters, const ProcessGroups& groups, const TLProcess& process,
                     bool summarize) {
    const auto& ownGroups = groups.groupsOf(process);
    if (process.hasErrors() || ownGroups.empty()) {
        for (const auto& formatter : formatters) {
            formatter->printProcessCategories({}, {});
        }
        return;
    }
    for (const auto& group : ownGroups) {
        const auto [categories, hasProcessView] = categoriesForGroup(*group, process, summarize);
        const TLMemoryTotals totals = totalsForCategories(*categories);
        for (const auto& formatter : formatters) {
            if (group->processes().size() == 1) {
                formatter->printProcessCategories(*categories, totals);
            } else {
                formatter->printSharedCategories(*categories, *group, process, hasProcessView, totals);
            }
        }
    }
}

/// Every object of the displayed processes, whole and once.
TLCategoryDictionary summaryCategories(const TLTally::ProcessList& displayedProcesses, bool summarize) {
    TLCategoryDictionary categories;
    std::vector<bool> counted; // by the number that the grouping gave the object
    for (const auto& process : displayedProcesses) {
        for (const TLMemoryRegion& region : process->memoryRegions()) {
            TLMemoryObject* const object = region.memoryObject;
            tl_assert(object->reportIndex != TLMemoryObject::notInReport, "object->reportIndex");
            if (object->reportIndex >= counted.size()) {
                counted.resize(object->reportIndex + 1);
            }
            if (!counted[object->reportIndex]) {
                counted[object->reportIndex] = true;
                categories.try_emplace(categoryKey(*object, summarize), TLMemoryCategory(summarize))
                    .first->second.addMemoryObject(object->shared_from_this());
            }
        }
    }
    return categories;
}

} // namespace

void TLTally::printReport(bool regionlistLikeOutput, bool summarize) {
    const ProcessList displayed = displayedProcesses();
    ProcessList sorted = displayed;
    std::ranges::stable_sort(
        sorted, [this](const auto& a, const auto& b) { return compareProcessesForDisplay(*a, *b); });

    for (const auto& formatter : outputFormatters_) {
        formatter->startAtTime(gatherStartTime_);
    }
    if (regionlistLikeOutput) {
        printRegionLists(outputFormatters_, sorted);
    }

    const ProcessGroups groups = groupProcesses(processes_);
    tables_.reset();

    Findings findings;
    for (const auto& process : sorted) {
        const std::optional<TLAuxDictionary> auxData = process->auxData();
        findings.add(process, auxData);
        printHeader(outputFormatters_, *process, totalOf(*process));
        printCategories(outputFormatters_, groups, *process, summarize);
        for (const auto& formatter : outputFormatters_) {
            formatter->printProcessAuxData(auxData);
        }
    }
    for (const auto& formatter : outputFormatters_) {
        formatter->printProcessesWithWarnings(findings.processesWithWarnings, findings.processesWithErrors,
                                              findings.globalErrors);
    }

    const TLCategoryDictionary summary = summaryCategories(displayed, summarize);
    const TLMemoryTotals totals = totalsForCategories(summary);
    for (const auto& formatter : outputFormatters_) {
        formatter->printSummaryCategories(summary, totals, findings.hadErrors());
    }
    for (const auto& formatter : outputFormatters_) {
        formatter->printGlobalAuxData(findings.globalAuxData);
    }
    for (const auto& formatter : outputFormatters_) {
        formatter->endAtTime(gatherEndTime_);
    }
    for (auto& [region, subranges] : takenSubranges_) {
        region->subrangeList = std::move(subranges);
    }
    takenSubranges_.clear();
}

} // namespace tally
