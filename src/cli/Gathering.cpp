// The gathering of a measurement: every process collects its own data, on all processors at once.
//
// What stops one process is a text of that process; only an interrupt stops the gather.

#include "analysis/TLTally.h"
#include "base/Format.h"
#include "cli/Usage.h"
#include "platform/gather.h"
#include "vm/PhysTallyCollection.h"

#include <algorithm>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace tally {

namespace {

bool compareProcessesForGather(const std::shared_ptr<TLProcess>& a, const std::shared_ptr<TLProcess>& b) {
    return a->pid() > b->pid();
}

/// Leaves what this machine costs every process to the lowest pid of those that are shown, with their number.
void mergeMachineWarnings(const TLTally::ProcessList& sorted) {
    std::map<std::string, std::vector<TLProcess*>> processes;
    for (auto process = sorted.rbegin(); process != sorted.rend(); ++process) {
        for (const std::string& text : (*process)->takeMachineWarnings()) {
            if (!(*process)->hiddenFromDisplay()) {
                processes[text].push_back(process->get());
            }
        }
    }
    for (const auto& [text, holders] : processes) {
        for (std::size_t i = 0; i < holders.size() && holders.size() > 1; ++i) {
            const std::string told = formatted("%s (so for %zu processes)", text.c_str(), holders.size());
            holders[i]->replaceWarning(text, i == 0 ? told : "");
        }
    }
}

} // namespace

bool TLTally::gatherAllProcesses() {
    const platform::GatherScope scope;
    const platform::ConcurrentQueue gatherQueue{std::string(subsystemIdentifier) + ".gatherdata",
                                                qualityOfService};
    ProcessList sorted = processes_;
    std::ranges::stable_sort(sorted, compareProcessesForGather);

    gatherStartTime_ = TLTime::now();
    std::atomic<bool> interrupted = false;
    platform::dispatch_apply(sorted.size(), gatherQueue, [&](std::size_t index) {
        if (earlyExit) {
            interrupted = true;
        } else {
            sorted[index]->gatherData();
        }
    });
    mergeMachineWarnings(sorted);
    // An interrupted sample is never reported, and the process may be in an earlier one that is.
    if (interrupted && !isSample) {
        // Nobody is told what a hidden process says.
        const auto shown = std::find_if(sorted.rbegin(), sorted.rend(),
                                        [](const auto& process) { return !process->hiddenFromDisplay(); });
        (shown == sorted.rend() ? sorted.back() : *shown)
            ->_addGlobalError("Tally exited early due to SIGINT and did not finish gathering all data");
    }
    gatherEndTime_ = TLTime::now();
    return interrupted;
}

std::unique_ptr<platform::SignalSource> TLTally::installSigintHandler(std::function<void()> handler,
                                                                      platform::InterruptSignals signals) {
    return platform::dispatch_source_interrupt(signals, std::move(handler));
}

bool TLTally::physTallyCollectionEnabled() { return tally::physTallyCollectionEnabled(); }

void TLTally::setPhysTallyCollectionEnabled(int value) { tally::setPhysTallyCollectionEnabled(value); }

} // namespace tally
