// Answer: the frame in which the scripted kernel answers one call.
//
// Making one takes the kernel's lock, records the call, runs what a test wants done before it and decides
// whether the call is to fail. The lock is held until the answer is complete.

#pragma once

#include "platform/scripted/KernelState.h"
#include "platform/scripted/ScriptedKernel.h"

#include <cerrno>
#include <cstddef>
#include <mutex>

namespace tally::platform {

/// Names a port as the subject of a call.
struct PortName {
    mach_port_t port = MACH_PORT_NULL;
};

class Answer {
  public:
    using Numbers = std::vector<std::uint64_t>;

    explicit Answer(const char* call, std::int32_t pid = -1, Numbers arguments = {},
                    std::string_view text = {});
    Answer(const char* call, PortName port, Numbers arguments = {}, std::string_view text = {});
    Answer(const Answer&) = delete;
    Answer& operator=(const Answer&) = delete;

    ScriptedKernel& kernel;
    KernelState& state;
    int fault = 0; // what the call is to fail with; 0: it is answered

    /// The task that `port` names; null when it has ended or there is no such port.
    ScriptedTask* taskOfPort(mach_port_t port) const;
    /// The process of `pid` that runs; null otherwise.
    ScriptedTask* runningTask(std::int32_t pid) const;
    View view() const { return kernel.selfRegionTally.value_or(0) != 0 ? View::charged : View::object; }

    /// The end of a call that fails with errno.
    static int refuse(int error) {
        errno = error;
        return -1;
    }

  private:
    void begin(const CallRecord& record);

    std::lock_guard<std::recursive_mutex> lock_;
};

} // namespace tally::platform
