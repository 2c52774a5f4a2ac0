// Clocks, the interrupt source, timers and the tool's own process.

#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/output_file.h"
#include "platform/system.h"

#include "platform/scripted/Answer.h"

namespace tally::platform {

namespace {

constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;

class InterruptSource final : public SignalSource {
  public:
    InterruptSource(KernelState& state, KernelState::InterruptHandler handler) : state_(state) {
        state_.interruptHandlers[this] = std::move(handler);
    }
    ~InterruptSource() override { cancel(); }
    void cancel() override {
        const std::lock_guard lock(state_.mutex); // an interrupt holds it while handlers run
        state_.interruptHandlers.erase(this);
    }

  private:
    KernelState& state_;
};

class Timer final : public TimerSource {
  public:
    Timer(KernelState& state, SerialQueue& queue, std::function<void(std::uint64_t)> handler)
        : state_(state), timer_{.queue = &queue, .handler = std::move(handler)} {
        state_.timer = &timer_;
    }
    ~Timer() override {
        const std::lock_guard lock(state_.mutex);
        state_.timer = nullptr;
    }
    void setTimer(std::uint64_t start, std::uint64_t interval, std::uint64_t leeway) override {
        const Answer answer("setTimer", -1, {start, interval, leeway});
        timer_.isSet = true;
    }
    void cancel() override {
        const std::lock_guard lock(state_.mutex);
        timer_.isSet = false;
    }

  private:
    KernelState& state_;
    KernelState::Timer timer_;
};

/// The first mapping of `task` that shows the file of `path`; null when there is none.
const ScriptedMapping* mappingOfFile(const ScriptedTask& task, const std::string& path) {
    const ScriptedMapping* mapping = task.findMapping(0, 0).mapping;
    while (mapping != nullptr && mapping->file != path) {
        mapping = task.findMapping(mapping->end(), 0).mapping;
    }
    return mapping;
}

} // namespace

int mach_get_times(mach_times* times) {
    const Answer answer("mach_get_times");
    if (answer.fault != 0) {
        return answer.fault;
    }
    const ScriptedKernel& kernel = answer.kernel;
    const std::uint64_t ticks = answer.state.clockReadings++ * kernel.ticksBetweenReadings;
    const std::int64_t nanoseconds =
        kernel.times.wall_nanoseconds + ticks * kernel.timebase.numer / kernel.timebase.denom;
    *times = {.absolute_ticks = kernel.times.absolute_ticks + ticks,
              .continuous_ticks = kernel.times.continuous_ticks + ticks,
              .wall_seconds = kernel.times.wall_seconds + nanoseconds / nanosecondsPerSecond,
              .wall_nanoseconds = nanoseconds % nanosecondsPerSecond};
    return 0;
}

std::uint64_t clock_uptime_raw_approx_ns() {
    return Answer("clock_uptime_raw_approx_ns").kernel.uptimeNanoseconds;
}

void mach_timebase_info(mach_timebase* timebase) { *timebase = Answer("mach_timebase_info").kernel.timebase; }

std::unique_ptr<SignalSource> dispatch_source_interrupt(InterruptSignals which,
                                                        std::function<void()> handler) {
    const Answer answer("dispatch_source_interrupt", -1, {static_cast<std::uint64_t>(which)});
    if (answer.fault != 0) {
        return nullptr;
    }
    return std::make_unique<InterruptSource>(
        answer.state,
        KernelState::InterruptHandler{.call = std::move(handler),
                                      .takesTermination = which == InterruptSignals::sigintAndTermination});
}

void restoreDefaultInterruptAction() { const Answer answer("restoreDefaultInterruptAction"); }

std::unique_ptr<TimerSource> dispatch_source_timer(SerialQueue& queue,
                                                   std::function<void(std::uint64_t)> handler) {
    const Answer answer("dispatch_source_timer", -1, {}, queue.label);
    if (answer.fault != 0) {
        Answer::refuse(answer.fault);
        return nullptr;
    }
    return std::make_unique<Timer>(answer.state, queue, std::move(handler));
}

std::optional<FileInMemory> fileInMemory(const std::string& path) {
    const Answer answer("fileInMemory", -1, {}, path);
    for (const auto& task : answer.state.tasks) {
        if (const ScriptedMapping* mapping = mappingOfFile(*task, path)) {
            return FileInMemory{.path = path, .object = *mapping->object};
        }
    }
    return std::nullopt;
}

bool mapsFile(std::int32_t pid, const FileInMemory& file) {
    const Answer answer("mapsFile", pid, {}, file.path);
    const ScriptedTask* const task = answer.runningTask(pid);
    return task != nullptr && mappingOfFile(*task, file.path) != nullptr;
}

void prepareOwnProcess() { const Answer answer("prepareOwnProcess"); }

void endWithClosedPipe() { const Answer answer("endWithClosedPipe"); }

std::string whatMeasuringLacks() { return {}; }

bool standardOutputIsTerminal() { return Answer("standardOutputIsTerminal").kernel.outputIsTerminal; }

std::uint32_t effectiveUserId() { return Answer("effectiveUserId").kernel.effectiveUserId; }

std::int32_t ownPid() { return Answer("ownPid").kernel.ownPid; }

bool hasInternalContent(const char* subsystem) {
    return Answer("hasInternalContent", -1, {}, subsystem).kernel.internalContent.contains(subsystem);
}

} // namespace tally::platform
