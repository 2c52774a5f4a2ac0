// Ports of tasks and corpses, and what a gather keeps of them.

#include "platform/gather.h"
#include "platform/mach_task.h"

#include "base/Assertion.h"
#include "platform/scripted/Answer.h"

#include <algorithm>

namespace tally::platform {

kern_return_t task_read_for_pid(std::int32_t pid, mach_port_t* task) {
    const Answer answer("task_read_for_pid", pid);
    *task = MACH_PORT_NULL;
    ScriptedTask* scripted = answer.kernel.findTask(pid); // a zombie has a port too, of a dead task
    if (answer.fault != 0 || scripted == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_FAILURE;
    }
    if (scripted->portStatus != KERN_SUCCESS) {
        return scripted->portStatus;
    }
    for (auto& [name, port] : answer.state.ports) {
        if (port.task == scripted) {
            ++port.references;
            *task = name;
            return KERN_SUCCESS;
        }
    }
    *task = answer.state.lastPort += 4;
    answer.state.ports[*task] = {.task = scripted, .corpse = nullptr, .references = 1};
    return KERN_SUCCESS;
}

kern_return_t task_generate_corpse(mach_port_t task, mach_port_t* corpse) {
    const Answer answer("task_generate_corpse", PortName{task});
    *corpse = MACH_PORT_NULL;
    const auto port = answer.state.ports.find(task);
    if (answer.fault != 0 || port == answer.state.ports.end() || port->second.corpse != nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (scripted == nullptr) {
        return KERN_TERMINATED;
    }
    if (scripted->corpseStatus != KERN_SUCCESS) {
        return scripted->corpseStatus;
    }
    auto copy = std::make_unique<ScriptedTask>(*scripted);
    ScriptedTask* const frozen = copy.get();
    *corpse = answer.state.lastPort += 4;
    answer.state.ports[*corpse] = {.task = frozen, .corpse = std::move(copy), .references = 1};
    return KERN_SUCCESS;
}

kern_return_t task_map_corpse_info_64(mach_port_t corpse, std::span<const std::byte>* buffer) {
    const Answer answer("task_map_corpse_info_64", PortName{corpse});
    const auto port = answer.state.ports.find(corpse);
    if (answer.fault != 0 || port == answer.state.ports.end() || port->second.corpse == nullptr) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    auto& buffers = answer.state.buffers;
    buffers.push_back(std::make_unique<std::vector<std::byte>>(port->second.corpse->crashInformation));
    *buffer = *buffers.back();
    return KERN_SUCCESS;
}

kern_return_t vm_deallocate(std::span<const std::byte> buffer) {
    const Answer answer("vm_deallocate", -1, {buffer.size()});
    auto& buffers = answer.state.buffers;
    const auto found = std::find_if(buffers.begin(), buffers.end(), [&](const auto& held) {
        return held->data() == buffer.data() && held->size() == buffer.size();
    });
    if (answer.fault != 0 || found == buffers.end()) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ADDRESS;
    }
    buffers.erase(found);
    return KERN_SUCCESS;
}

kern_return_t mach_port_retain(mach_port_t port) {
    const Answer answer("mach_port_retain", PortName{port}, {port});
    const auto found = answer.state.ports.find(port);
    if (answer.fault != 0 || found == answer.state.ports.end()) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    ++found->second.references;
    return KERN_SUCCESS;
}

kern_return_t mach_port_deallocate(mach_port_t port) {
    const Answer answer("mach_port_deallocate", PortName{port}, {port});
    const auto found = answer.state.ports.find(port);
    if (answer.fault != 0 || found == answer.state.ports.end()) {
        return answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
    }
    if (--found->second.references == 0) {
        answer.state.ports.erase(found);
    }
    return KERN_SUCCESS;
}

GatherScope::GatherScope() {
    const Answer answer("GatherScope");
    tl_assert(!answer.state.gathering, "one gather at a time");
    answer.state.gathering = true;
}

GatherScope::~GatherScope() {
    KernelState& state = ScriptedKernel::current().state();
    const std::lock_guard lock(state.mutex);
    state.gathering = false;
}

task_notices task_take_notices(mach_port_t task) {
    const Answer answer("task_take_notices", PortName{task});
    const auto port = answer.state.ports.find(task); // also of a task that has ended meanwhile
    if (answer.fault != 0 || port == answer.state.ports.end()) {
        return {};
    }
    return std::exchange(port->second.task->notices, {});
}

bool task_has_relatives(mach_port_t task) {
    const Answer answer("task_has_relatives", PortName{task});
    const ScriptedTask* const scripted = answer.taskOfPort(task);
    return scripted == nullptr ||
           (scripted->family != 0 && std::ranges::any_of(answer.state.ports, [&](const auto& entry) {
                const ScriptedTask& other = *entry.second.task;
                return other.family == scripted->family && other.pid != scripted->pid;
            }));
}

} // namespace tally::platform
