// The images of a task, and what the kernel's own code is called.

#include "platform/runekit.h"

#include "platform/linux/calls/Task.h"
#include "platform/linux/corpse/Corpse.h"
#include "platform/linux/images/SymbolOwners.h"
#include "platform/linux/io/Notes.h"

#include <algorithm>
#include <utility>

namespace tally::platform {

void RKForeachSymbolOwner(mach_port_t port, const std::function<void(const RKSymbolOwner&)>& handler) {
    const std::shared_ptr<Task> task = taskOfPort(port);
    if (task && task->corpse() != nullptr) {
        std::ranges::for_each(task->corpse()->images(), handler);
        return;
    }
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task ? task->walk(&status) : nullptr;
    if (walk == nullptr) {
        return; // the walk of the regions meets that too, and reports it
    }
    std::vector<std::string> notes;
    {
        const NoteTaker taker(notes);
        std::ranges::for_each(symbolOwnersOf(walk->mappings(), walk->folder()), handler);
    }
    task->addNotices(std::move(notes));
}

// The kernel lists files by the paths that they were found at in the end, as the task sees them.
std::string RKResolvedPath(mach_port_t /*task*/, std::string_view path) { return std::string(path); }

// The kernel names its callers itself, so its symbols are not read for that.
std::unique_ptr<RKKernelSymbolicator> RKCreateKernelSymbolicator() { return nullptr; }

} // namespace tally::platform
