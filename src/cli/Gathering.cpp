// The gathering of a measurement: every process collects its own data, on all processors at once.
//
// What stops one process is a text of that process; only an interrupt stops the gather.

#include "analysis/TLTally.h"
#include "cli/Usage.h"
#include "platform/gather.h"
#include "vm/PhysTallyCollection.h"

#include <algorithm>
#include <string>
#include <utility>

namespace tally {

namespace {

bool compareProcessesForGather(const std::shared_ptr<TLProcess>& a, const std::shared_ptr<TLProcess>& b) {
    return a->pid() > b->pid();
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
