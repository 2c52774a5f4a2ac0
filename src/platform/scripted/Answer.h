// Answer: the frame in which the scripted kernel answers one call.
//
// Making one takes the kernel's lock, records the call, runs what a test wants done before it and decides
// whether the call is to fail. The lock is held until the answer is complete.

#pragma once

#include "platform/dispatch.h"
#include "platform/scripted/ScriptedKernel.h"

#include <cerrno>
#include <condition_variable>
#include <cstddef>
#include <mutex>

namespace tally::platform {

struct ScriptedKernel::State {
    struct Fault {
        std::string call;
        CallSelector which;
        int error = 0; // 0: the action runs instead
        std::function<void()> action;
        std::uint64_t seen = 0;

        /// Counts a call that `record` describes. @return whether it is one of those meant.
        bool meets(const CallRecord& record);
    };
    struct Port {
        ScriptedTask* task = nullptr;
        std::unique_ptr<ScriptedTask> corpse; // owns `task` where the port is a corpse's
        std::uint32_t references = 1;
    };

    struct InterruptHandler {
        std::function<void()> call;
        bool takesSigint = true;
        bool takesTermination = false;
    };
    struct Timer {
        SerialQueue* queue = nullptr;
        std::function<void(std::uint64_t)> handler;
        bool isSet = false;
    };

    /// Calls the handlers of the sources that take such a signal. @return whether there was one.
    bool deliver(bool InterruptHandler::*isTaken);

    mutable std::recursive_mutex mutex; // an action may ask the kernel itself
    std::condition_variable_any called;
    std::vector<std::unique_ptr<ScriptedTask>> tasks;
    std::map<std::int32_t, ScriptedTask*> tasksByPid;
    std::map<mach_port_t, Port> ports;
    mach_port_t lastPort = 0x103;
    std::vector<std::unique_ptr<std::vector<std::byte>>> buffers;
    std::uint64_t lastObjectId = 0x7a11'0000'0000;
    std::vector<std::unique_ptr<Fault>> faults; // never shrinks: an action may add one
    std::vector<CallRecord> calls;
    std::map<const void*, InterruptHandler> interruptHandlers; // by source
    Timer* timer = nullptr;                                    // the one that exists
    std::uint64_t clockReadings = 0;
    bool gathering = false;
};

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
    ScriptedKernel::State& state;
    int fault = 0; // what the call is to fail with; 0: it is answered

    /// The task that `port` names; null when it has ended or there is no such port.
    ScriptedTask* taskOfPort(mach_port_t port) const;
    /// The process of `pid` that runs; null otherwise.
    ScriptedTask* runningTask(std::int32_t pid) const;
    bool isCharged() const { return kernel.selfRegionTally.value_or(0) != 0; }

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
