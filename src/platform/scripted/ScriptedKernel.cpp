#include "platform/scripted/ScriptedKernel.h"

#include "base/Assertion.h"
#include "platform/scripted/Answer.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <span>
#include <stdexcept>

namespace tally::platform {

namespace {

// The calls are free functions: where they find their kernel is a variable of the run.
std::atomic<ScriptedKernel*>& currentKernel() {
    static std::atomic<ScriptedKernel*> kernel = nullptr;
    return kernel;
}

// A fault for a call that is in neither list would never happen, and its test would prove nothing.
constexpr std::array<std::string_view, 35> callsThatCanFail{
    "QRYRegionTypeDescriptionForTag",
    "RKCreateKernelSymbolicator",
    "RKForeachSymbolOwner",
    "RKResolvedPath",
    "copyLoadedModuleIdentifiers",
    "dispatch_source_interrupt",
    "dispatch_source_timer",
    "dyld_shared_cache_for_task",
    "ledger_entries",
    "ledger_template",
    "mach_get_times",
    "mach_memory_info",
    "mach_port_deallocate",
    "mach_port_retain",
    "mach_vm_next_page",
    "mach_vm_page_range_query",
    "mach_vm_purgable_get_state",
    "mach_vm_region",
    "mach_vm_region_recurse",
    "proc_get_dirty",
    "proc_listallpids",
    "proc_pid_rusage",
    "proc_pidinfo",
    "proc_pidshortinfo",
    "proc_regionfilename",
    "sysctl_argmax",
    "sysctl_owned_vmobjects",
    "sysctl_procargs2",
    "sysctlbyname_read",
    "sysctlbyname_write",
    "task_generate_corpse",
    "task_map_corpse_info_64",
    "task_read_for_pid",
    "task_take_notices",
    "vm_deallocate",
};
constexpr std::array<std::string_view, 16> callsThatCannot{
    "GatherScope",
    "QRYTagForRegionTypeDescription",
    "clock_uptime_raw_approx_ns",
    "effectiveUserId",
    "endWithClosedPipe",
    "fileInMemory",
    "hasInternalContent",
    "mach_timebase_info",
    "mapsFile",
    "ownPid",
    "prepareOwnProcess",
    "restoreDefaultInterruptAction",
    "setTimer",
    "standardOutputIsTerminal",
    "task_has_relatives",
    "vm_kernel_page_size",
};

bool isOneOf(std::span<const std::string_view> names, std::string_view call) {
    return std::find(names.begin(), names.end(), call) != names.end();
}

void requireCallName(std::string_view call, bool canFail) {
    if (!isOneOf(callsThatCanFail, call) && (canFail || !isOneOf(callsThatCannot, call))) {
        throw std::invalid_argument(std::string(call) + (canFail ? " cannot fail" : " is no platform call"));
    }
}

} // namespace

ScriptedKernel::ScriptedKernel() : state_(std::make_unique<State>()) {
    tl_assert(currentKernel().exchange(this) == nullptr, "one scripted kernel at a time");
}

ScriptedKernel::~ScriptedKernel() { currentKernel() = nullptr; }

ScriptedKernel& ScriptedKernel::current() {
    ScriptedKernel* kernel = currentKernel();
    tl_assert(kernel != nullptr, "a scripted kernel answers");
    return *kernel;
}

ScriptedTask& ScriptedKernel::addTask(TaskRecord record) {
    if (ScriptedTask* before = findTask(record.pid)) {
        before->exit();
    }
    const std::lock_guard lock(state_->mutex);
    state_->tasks.push_back(std::make_unique<ScriptedTask>(*this, std::move(record)));
    ScriptedTask& task = *state_->tasks.back();
    state_->tasksByPid[task.pid] = &task;
    return task;
}

ScriptedTask* ScriptedKernel::findTask(std::int32_t pid) const {
    const std::lock_guard lock(state_->mutex);
    const auto found = state_->tasksByPid.find(pid);
    const bool exists = found != state_->tasksByPid.end() && found->second->state != TaskState::gone;
    return exists ? found->second : nullptr;
}

std::uint64_t ScriptedKernel::makeObjectId() {
    const std::lock_guard lock(state_->mutex);
    return state_->lastObjectId += 0x100; // the low byte of an id says little
}

void ScriptedKernel::fail(std::string_view call, int error, CallSelector which) {
    requireCallName(call, true);
    tl_assert(error != 0, "a failing call has an error");
    const std::lock_guard lock(state_->mutex);
    state_->faults.push_back(std::make_unique<State::Fault>(
        State::Fault{.call = std::string(call), .which = which, .error = error, .action = {}}));
}

void ScriptedKernel::before(std::string_view call, std::function<void()> action, CallSelector which) {
    requireCallName(call, false);
    const std::lock_guard lock(state_->mutex);
    state_->faults.push_back(std::make_unique<State::Fault>(
        State::Fault{.call = std::string(call), .which = which, .error = 0, .action = std::move(action)}));
}

bool ScriptedKernel::interrupt() { return state_->deliver(&State::InterruptHandler::takesSigint); }

bool ScriptedKernel::terminate() { return state_->deliver(&State::InterruptHandler::takesTermination); }

bool ScriptedKernel::State::deliver(bool InterruptHandler::*isTaken) {
    const std::lock_guard lock(mutex);
    bool wasTaken = false;
    const auto handlers = interruptHandlers; // a handler may cancel its source
    for (const auto& [source, handler] : handlers) {
        if (handler.*isTaken) {
            wasTaken = true;
            handler.call();
        }
    }
    return wasTaken;
}

bool ScriptedKernel::fireTimer(std::uint64_t ticks) {
    SerialQueue* queue = nullptr;
    std::function<void(std::uint64_t)> handler;
    {
        const std::lock_guard lock(state_->mutex);
        if (state_->timer == nullptr || !state_->timer->isSet) {
            return false;
        }
        queue = state_->timer->queue;
        handler = state_->timer->handler;
    }
    queue->sync([&] { handler(ticks); }); // without the lock: the handler asks the kernel
    return true;
}

void ScriptedKernel::awaitCall(std::string_view call, std::uint64_t count) {
    requireCallName(call, false);
    std::unique_lock lock(state_->mutex);
    state_->called.wait(lock, [&] { return callCount(call) >= count; });
}

const std::vector<CallRecord>& ScriptedKernel::calls() const { return state_->calls; }

std::size_t ScriptedKernel::callCount(std::string_view name, std::optional<std::int32_t> pid) const {
    const std::lock_guard lock(state_->mutex);
    return std::count_if(state_->calls.begin(), state_->calls.end(), [&](const CallRecord& call) {
        return call.name == name && (!pid || call.pid == *pid);
    });
}

std::size_t ScriptedKernel::heldPortReferences() const {
    const std::lock_guard lock(state_->mutex);
    std::size_t references = 0;
    for (const auto& [name, port] : state_->ports) {
        references += port.references;
    }
    return references;
}

std::size_t ScriptedKernel::heldBuffers() const {
    const std::lock_guard lock(state_->mutex);
    return state_->buffers.size();
}

bool ScriptedKernel::State::Fault::meets(const CallRecord& record) {
    if (record.name != call || (which.pid && record.pid != *which.pid)) {
        return false;
    }
    ++seen;
    return seen >= which.nth && seen - which.nth < which.times;
}

Answer::Answer(const char* call, std::int32_t pid, Numbers arguments, std::string_view text)
    : kernel(ScriptedKernel::current()), state(kernel.state()), lock_(state.mutex) {
    begin({call, pid, std::move(arguments), std::string(text)});
}

Answer::Answer(const char* call, PortName port, Numbers arguments, std::string_view text)
    : kernel(ScriptedKernel::current()), state(kernel.state()), lock_(state.mutex) {
    const auto found = state.ports.find(port.port);
    const std::int32_t pid = found == state.ports.end() ? -1 : found->second.task->pid;
    begin({call, pid, std::move(arguments), std::string(text)});
}

void Answer::begin(const CallRecord& record) {
    requireCallName(record.name, false);
    state.calls.push_back(record);
    state.called.notify_all();
    for (std::size_t i = 0; i < state.faults.size(); ++i) {
        ScriptedKernel::State::Fault& candidate = *state.faults[i];
        if (!candidate.meets(record)) {
            continue;
        }
        if (candidate.action) {
            candidate.action();
        } else if (fault == 0) {
            fault = candidate.error;
        }
    }
}

ScriptedTask* Answer::taskOfPort(mach_port_t port) const {
    const auto found = state.ports.find(port);
    const bool lives = found != state.ports.end() && found->second.task->state == TaskState::alive;
    return lives ? found->second.task : nullptr;
}

ScriptedTask* Answer::runningTask(std::int32_t pid) const {
    ScriptedTask* task = kernel.findTask(pid);
    return task != nullptr && task->state == TaskState::alive ? task : nullptr;
}

} // namespace tally::platform
