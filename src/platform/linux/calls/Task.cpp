#include "platform/linux/calls/Task.h"

#include "platform/linux/calls/AccountingSwitch.h"
#include "platform/linux/corpse/Corpse.h"

#include <algorithm>
#include <mutex>
#include <unordered_map>
#include <utility>

namespace tally::platform {

namespace {

struct PortEntry {
    std::shared_ptr<Task> task;
    std::uint32_t references = 1;
};

class PortTable {
  public:
    mach_port_t add(std::shared_ptr<Task> task) {
        const std::scoped_lock lock(mutex_);
        const mach_port_t name = nextName_++;
        if (task->corpse() == nullptr) {
            byPid_[task->pid()] = name;
        }
        ports_.emplace(name, PortEntry{std::move(task)});
        return name;
    }

    std::shared_ptr<Task> find(mach_port_t name) {
        const std::scoped_lock lock(mutex_);
        const auto found = ports_.find(name);
        return found == ports_.end() ? nullptr : found->second.task;
    }

    std::shared_ptr<Task> findProcess(std::int32_t pid) {
        const std::scoped_lock lock(mutex_);
        const auto name = byPid_.find(pid);
        return name == byPid_.end() ? nullptr : ports_[name->second].task;
    }

    kern_return_t changeReferences(mach_port_t name, int change) {
        std::shared_ptr<Task> released; // destroyed after the lock is given back
        const std::scoped_lock lock(mutex_);
        const auto found = ports_.find(name);
        if (found == ports_.end()) {
            return KERN_INVALID_ARGUMENT;
        }
        found->second.references += static_cast<std::uint32_t>(change);
        if (found->second.references == 0) {
            released = std::move(found->second.task);
            const auto byPid = byPid_.find(released->pid());
            if (byPid != byPid_.end() && byPid->second == name) {
                byPid_.erase(byPid);
            }
            ports_.erase(found);
        }
        return KERN_SUCCESS;
    }

  private:
    std::mutex mutex_;
    mach_port_t nextName_ = 0x103; // 0 is no port
    std::unordered_map<mach_port_t, PortEntry> ports_;
    std::unordered_map<std::int32_t, mach_port_t> byPid_; // the latest right to each process
};

/// Never destroyed: rights that are left at the end of the process are the kernel's to release, and other
/// tables, which a task would take leave of, may be gone before.
PortTable& portTable() {
    static PortTable& table = *new PortTable;
    return table;
}

} // namespace

Task::Task(MemberIdentity identity, const FamilyKey& key)
    : identity_(identity), key_(key), owner_(enterAddressSpace(key, identity)) {}

Task::Task(std::shared_ptr<Corpse> corpse)
    : identity_(corpse->identity()), owner_(std::make_shared<MemberIdentity>(corpse->owner())),
      corpse_(std::move(corpse)) {}

Task::~Task() {
    if (!corpse_) {
        leaveAddressSpace(key_, identity_);
    }
}

bool Task::hasRelatives() const {
    return corpse_ ? corpse_->hasRelatives() : !key_.isKnown() || countRelatives(key_) > 1;
}

std::optional<ResidentMemory> Task::resident() const { return walk_ ? walk_->resident() : std::nullopt; }

std::vector<std::string> Task::takeNotices() {
    if (corpse_) {
        addNotices(corpse_->notices());
    }
    return std::exchange(notices_, {});
}

const Walk* Task::walk(kern_return_t* status) {
    if (corpse_) {
        *status = KERN_SUCCESS;
        return corpse_->walk();
    }
    if (!walk_ && walkStatus_ == KERN_SUCCESS) {
        if (isSecondTenant() && compareAddressSpaces(identityOf(owner_).pid, identity_.pid) != 0) {
            owner_ = std::make_shared<MemberIdentity>(identity_); // it has loaded another program since
        }
        Walk::Result result =
            Walk::read(identity_, key_, identityOf(owner_), currentView(), std::exchange(status_, {}));
        walkStatus_ = result.status;
        walk_ = std::move(result.walk);
        addNotices(std::move(result.notices));
    }
    *status = walkStatus_;
    return walk_.get();
}

void Task::addNotices(std::vector<std::string> notices) {
    for (std::string& notice : notices) {
        if (std::find(given_.begin(), given_.end(), notice) == given_.end()) {
            given_.push_back(notice);
            notices_.push_back(std::move(notice));
        }
    }
}

mach_port_t makePort(std::shared_ptr<Task> task) { return portTable().add(std::move(task)); }

std::shared_ptr<Task> taskOfPort(mach_port_t port) { return portTable().find(port); }

std::shared_ptr<Task> taskOfProcess(std::int32_t pid) { return portTable().findProcess(pid); }

kern_return_t changeReferences(mach_port_t port, int change) {
    return portTable().changeReferences(port, change);
}

} // namespace tally::platform
