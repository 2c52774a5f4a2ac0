// TLTally: which processes a report shows, and in which order.

#include "analysis/TLTally.h"

#include <algorithm>
#include <iterator>
#include <tuple>

namespace tally {

TLTally::ProcessList TLTally::displayedProcesses() const {
    ProcessList displayed;
    std::ranges::copy_if(processes_, std::back_inserter(displayed),
                         [](const auto& process) { return !process->hiddenFromDisplay(); });
    return displayed;
}

std::optional<std::uint64_t> TLTally::totalOf(const TLProcess& process) const {
    const auto found = pidToTally_.find(process.pid());
    return found == pidToTally_.end() ? std::nullopt : std::optional(found->second);
}

bool TLTally::compareProcessesForDisplay(const TLProcess& a, const TLProcess& b) const {
    return std::tuple(totalOf(a), a.pid()) > std::tuple(totalOf(b), b.pid());
}

} // namespace tally
