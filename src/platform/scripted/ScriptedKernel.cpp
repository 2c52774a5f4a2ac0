#include "platform/scripted/ScriptedKernel.h"

#include "base/Assertion.h"
#include "platform/scripted/KernelState.h"

#include <algorithm>
#include <atomic>

namespace tally::platform {

namespace {

// The calls are free functions: where they find their kernel is a variable of the run.
std::atomic<ScriptedKernel*>& currentKernel() {
    static std::atomic<ScriptedKernel*> kernel = nullptr;
    return kernel;
}

} // namespace

ScriptedKernel::ScriptedKernel() : state_(std::make_unique<KernelState>()) {
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
    state_->tasks.push_back(std::make_unique<ScriptedTask>(
        pageSize, [this] { return makeObjectId(); }, std::move(record)));
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
    state_->faults.push_back(std::make_unique<KernelState::Fault>(
        KernelState::Fault{.call = std::string(call), .which = which, .error = error, .action = {}}));
}

void ScriptedKernel::before(std::string_view call, std::function<void()> action, CallSelector which) {
    requireCallName(call, false);
    const std::lock_guard lock(state_->mutex);
    state_->faults.push_back(std::make_unique<KernelState::Fault>(KernelState::Fault{
        .call = std::string(call), .which = which, .error = 0, .action = std::move(action)}));
}

bool ScriptedKernel::interrupt() { return state_->deliver(&KernelState::InterruptHandler::takesSigint); }

bool ScriptedKernel::terminate() { return state_->deliver(&KernelState::InterruptHandler::takesTermination); }

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

} // namespace tally::platform
