// KernelState: what the scripted kernel's answers keep between calls.

#pragma once

#include "platform/dispatch.h"
#include "platform/scripted/PlatformCalls.h"
#include "platform/scripted/ScriptedTask.h"

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

namespace tally::platform {

struct KernelState {
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

} // namespace tally::platform
