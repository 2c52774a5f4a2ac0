// Rights to tasks, and corpses.

#include "platform/mach_task.h"

#include "platform/linux/calls/AccountingSwitch.h"
#include "platform/linux/calls/Task.h"
#include "platform/linux/corpse/Corpse.h"
#include "platform/linux/machine/ProcessStat.h"

#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

/// Crash information that callers have asked for and not given back.
struct MappedInformation {
    std::mutex mutex;
    std::map<const std::byte*, std::vector<std::byte>> buffers;
};

MappedInformation& mappedInformation() {
    static MappedInformation information;
    return information;
}

} // namespace

kern_return_t task_read_for_pid(std::int32_t pid, mach_port_t* task) {
    *task = MACH_PORT_NULL;
    const std::optional<ProcessStat> stat = readProcessStat(pid);
    if (!stat || stat->isKernelThread()) {
        return KERN_FAILURE;
    }
    if (!stat->showsMemory()) {
        return KERN_NO_ACCESS;
    }
    *task = makePort(std::make_shared<Task>(MemberIdentity{pid, stat->startTicks}, familyKeyOf(*stat)));
    return KERN_SUCCESS;
}

kern_return_t mach_port_retain(mach_port_t port) { return changeReferences(port, 1); }

kern_return_t mach_port_deallocate(mach_port_t port) { return changeReferences(port, -1); }

kern_return_t task_generate_corpse(mach_port_t task, mach_port_t* corpse) {
    *corpse = MACH_PORT_NULL;
    const std::shared_ptr<Task> live = taskOfPort(task);
    if (!live || live->corpse() != nullptr) {
        return KERN_INVALID_ARGUMENT;
    }
    std::shared_ptr<Corpse> made;
    const kern_return_t status = makeCorpse(live->identity(), currentView(), &made);
    if (status == KERN_SUCCESS) {
        *corpse = makePort(std::make_shared<Task>(std::move(made)));
    }
    return status;
}

kern_return_t task_map_corpse_info_64(mach_port_t corpse, std::span<const std::byte>* buffer) {
    *buffer = {};
    const std::shared_ptr<Task> task = taskOfPort(corpse);
    if (!task || task->corpse() == nullptr) {
        return KERN_INVALID_ARGUMENT;
    }
    const auto information = task->corpse()->crashInformation();
    std::vector<std::byte> copy(information.begin(), information.end());
    *buffer = copy;
    MappedInformation& mapped = mappedInformation();
    const std::scoped_lock lock(mapped.mutex);
    mapped.buffers.emplace(copy.data(), std::move(copy));
    return KERN_SUCCESS;
}

kern_return_t vm_deallocate(std::span<const std::byte> buffer) {
    MappedInformation& mapped = mappedInformation();
    const std::scoped_lock lock(mapped.mutex);
    return mapped.buffers.erase(buffer.data()) == 1 ? KERN_SUCCESS : KERN_INVALID_ADDRESS;
}

} // namespace tally::platform
