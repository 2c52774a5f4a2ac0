#include "platform/scripted/Answer.h"

namespace tally::platform {

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
        KernelState::Fault& candidate = *state.faults[i];
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
