// Clocks, the interrupt source, the performance-data writer and the tool's own process.

#include "platform/benchlog.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/system.h"

#include "platform/scripted/Answer.h"

namespace tally::platform {

namespace {

constexpr std::int64_t nanosecondsPerSecond = 1'000'000'000;

class InterruptSource final : public SignalSource {
  public:
    InterruptSource(ScriptedKernel::State& state, std::function<void()> handler) : state_(state) {
        state_.interruptHandlers[this] = std::move(handler);
    }
    ~InterruptSource() override { cancel(); }
    void cancel() override {
        const std::lock_guard lock(state_.mutex); // an interrupt holds it while handlers run
        state_.interruptHandlers.erase(this);
    }

  private:
    ScriptedKernel::State& state_;
};

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

void mach_timebase_info(mach_timebase* timebase) { *timebase = Answer("mach_timebase_info").kernel.timebase; }

std::unique_ptr<SignalSource> dispatch_source_sigint(std::function<void()> handler) {
    const Answer answer("dispatch_source_sigint");
    return answer.fault != 0 ? nullptr : std::make_unique<InterruptSource>(answer.state, std::move(handler));
}

void restoreDefaultSigintAction() { const Answer answer("restoreDefaultSigintAction"); }

std::unique_ptr<BenchlogWriter> blwriter_open(const char* path) {
    const Answer answer("blwriter_open", -1, {}, path);
    if (answer.fault != 0) {
        Answer::refuse(answer.fault);
        return nullptr;
    }
    return std::make_unique<BenchlogWriter>();
}

void prepareStandardStreams() { const Answer answer("prepareStandardStreams"); }

bool standardOutputIsTerminal() { return Answer("standardOutputIsTerminal").kernel.outputIsTerminal; }

std::uint32_t effectiveUserId() { return Answer("effectiveUserId").kernel.effectiveUserId; }

std::int32_t ownPid() { return Answer("ownPid").kernel.ownPid; }

bool hasInternalContent(const char* subsystem) {
    return Answer("hasInternalContent", -1, {}, subsystem).kernel.internalContent.contains(subsystem);
}

} // namespace tally::platform
