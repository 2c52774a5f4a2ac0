#include "platform/linux/machine/Charges.h"

#include "platform/linux/io/Pages.h"
#include "platform/linux/machine/MachineState.h"

#include <algorithm>

namespace tally::platform {

namespace {

/// What VmPTE leaves out: the top-level table is a page. Larger pages map so much that it has a few entries
/// only, from a cache of the kernel's.
const std::uint64_t topLevelTable = basePage == 4096 ? basePage : 0;

} // namespace

Charges chargesOf(const ProcessStatus& status, bool isSecondTenant) {
    Charges charges;
    if (status.hasAddressSpace) {
        charges.pageTable = isSecondTenant ? 0 : status.pageTables + topLevelTable;
        charges.physTally = status.residentAnonymous + status.residentShared + status.hugetlb +
                            status.swapped + charges.pageTable;
        charges.peak = std::max(charges.physTally, status.peakResident);
        charges.residentAnonymous = status.residentAnonymous;
    }
    return charges;
}

std::optional<ProcessStatus> readExactStatus(std::int32_t pid, const std::optional<ResidentMemory>& counted) {
    std::optional<ProcessStatus> status = readProcessStatus(pid);
    if (status && counted && machineState().countersLag) {
        status->residentAnonymous = counted->anonymous;
        status->residentShared = counted->shared;
        status->swapped = counted->swapped;
    }
    return status;
}

std::optional<Charges> readCharges(std::int32_t pid, bool isSecondTenant,
                                   const std::optional<ResidentMemory>& counted) {
    const std::optional<ProcessStatus> status = readExactStatus(pid, counted);
    return status ? std::optional(chargesOf(*status, isSecondTenant)) : std::nullopt;
}

} // namespace tally::platform
