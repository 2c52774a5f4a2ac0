#include "cli/Sampling.h"

#include "analysis/TLTally.h"
#include "base/Format.h"
#include "cli/TargetBuilding.h"
#include "cli/Usage.h"
#include "platform/clock.h"
#include "platform/dispatch.h"
#include "platform/gather.h"
#include "platform/system.h"
#include "process/TLUserProcess.h"

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <limits>
#include <memory>
#include <mutex>
#include <system_error>
#include <utility>

namespace tally {

using namespace platform;

namespace {

constexpr double nanosecondsPerSecond = 1e9;

// Gathered samples that wait for their report. Where reports take longer than the interval, or nobody reads
// them, ticks are missed then, instead of memory being used up.
constexpr int mostWaitingSamples = 16;

std::uint64_t nanoseconds(double seconds) {
    const double exact = seconds * nanosecondsPerSecond;
    constexpr auto most = std::numeric_limits<std::uint64_t>::max();
    return exact < static_cast<double>(most) ? static_cast<std::uint64_t>(exact) : most;
}

/// Whether `old`, gathered for the last sample, still tells what gathering `current`, which stands for the
/// same pid, would.
bool isUnchanged(const TLUserProcess& old, const TLUserProcess& current) {
    const bool isUsable =
        old.hasMemoryRegions() && !old.hasErrors() && old.hiddenFromDisplay() == current.hiddenFromDisplay();
    // No charge shows memory that a relative has left to this process, nor what is owned without a mapping.
    const auto isUnmapped = [](const TLMemoryRegion& region) { return region.user_tag == TLUnmappedTag; };
    return isUsable && old.phys_tally() != 0 && old.phys_tally() == current.phys_tally() &&
           old.displayString() == current.displayString() && !task_has_relatives(current.task()) &&
           std::ranges::none_of(old.memoryRegions(), isUnmapped);
}

/// Puts the processes of `last` that have not changed in the place of their successors among `targets`.
void carryUnchangedOver(const TLTally& last, TLProcessTable& targets) {
    for (const auto& process : last.processes()) {
        const auto* const old = dynamic_cast<const TLUserProcess*>(process.get());
        const auto found = targets.find(static_cast<std::uint64_t>(process->pid()));
        if (old == nullptr || found == targets.end()) {
            continue;
        }
        const auto* const current = dynamic_cast<const TLUserProcess*>(found->second.get());
        if (current != nullptr && isUnchanged(*old, *current)) {
            found->second = process;
        }
    }
}

class Sampler {
  public:
    /// Throws std::system_error when the system refuses a thread or a timer.
    Sampler(TLTallyArgs& args, OutputFiles& outputs);

    /// @return false when files are asked for and there is no sample to write to them.
    void run();

  private:
    void takeSample(std::uint64_t ticks);
    void stretchInterval(std::uint64_t now);
    void report(TLTally& tally);
    void stop();

    std::shared_ptr<TLTally> lastTally() {
        const std::lock_guard lock(lastTallyMutex_);
        return lastTally_.lock();
    }

    TLTallyArgs& args_;    // of the timer's queue
    OutputFiles& outputs_; // of the analysis queue, once there is a sample
    bool hasReported_ = false;
    const bool regionlistLikeOutput_ = args_.regionlistLikeOutput;
    const bool summarize_ = args_.summarize;
    const bool hasFiles_ = outputs_.hasFiles();

    std::uint64_t interval_ = nanoseconds(args_.sampleInterval); // only grows
    const std::uint64_t leeway_ = std::min(interval_, static_cast<std::uint64_t>(nanosecondsPerSecond)) / 2;
    std::uint64_t lastFireTime_ = clock_uptime_raw_approx_ns();
    bool isFirstMiss_ = true;

    std::mutex lastTallyMutex_;
    std::weak_ptr<TLTally> lastTally_; // alive while its analysis is queued or running

    Semaphore freePlaces_; // for samples that wait
    std::atomic<bool> isStopping_ = false;
    Semaphore finished_;
    SerialQueue analysisQueue_{std::string(subsystemIdentifier) + ".sample-analysis", QOS_CLASS_UTILITY};
    SerialQueue timerQueue_{std::string(subsystemIdentifier) + ".sample-timer"};
    std::unique_ptr<TimerSource> timer_ =
        dispatch_source_timer(timerQueue_, [this](std::uint64_t ticks) { takeSample(ticks); });
};

Sampler::Sampler(TLTallyArgs& args, OutputFiles& outputs) : args_(args), outputs_(outputs) {
    if (!timer_) {
        throw std::system_error(errno, std::generic_category());
    }
    for (int i = 0; i < mostWaitingSamples; ++i) {
        freePlaces_.signal();
    }
}

void Sampler::run() {
    for (const auto& formatter : outputs_.formatters()) {
        if (formatter->supportsMultipleOutputs()) {
            formatter->configureForMultipleOutputs();
        } else {
            std::fprintf(stderr, "Selected output format (%s) does not support sampling mode\n",
                         formatter->className());
        }
    }
    if (!hasFiles_) { // nothing is left to sample for where nobody reads the text
        endWithClosedPipe();
    }
    timer_->setTimer(0, interval_, leeway_);
    const auto interrupts =
        TLTally::installSigintHandler([this] { stop(); }, InterruptSignals::sigintAndTermination);
    std::fprintf(stderr, "Sampling at %.3gs interval... (<ctrl-c> to stop)\n", args_.sampleInterval);
    finished_.wait();
    std::fputs("Analyzing and writing output...\n", stderr);
    if (interrupts) {
        interrupts->cancel();
    }
    restoreDefaultInterruptAction();
    analysisQueue_.sync([] {});
    if (!hasReported_ && hasFiles_) {
        std::fputs("No sample was completed: files that held something stay as they are\n", stderr);
        outputs_.spareEarlier();
    }
}

void Sampler::stop() {
    timer_->cancel();
    isStopping_ = true;
    if (hasFiles_) {
        outputs_.stopWaitingForReader();
    }
    freePlaces_.signal(); // a sample may be waiting for one
    if (const std::shared_ptr<TLTally> last = lastTally()) {
        last->earlyExit = true;
    }
    std::fputs("\nStopping...\n", stderr);
    timerQueue_.async([this] { finished_.signal(); }); // behind a sample that is under way
}

void Sampler::stretchInterval(std::uint64_t now) {
    if (std::exchange(isFirstMiss_, false)) {
        return;
    }
    const std::uint64_t elapsed = now - lastFireTime_;
    if (elapsed > interval_) {
        interval_ += static_cast<std::uint64_t>(1.1 * static_cast<double>(elapsed - interval_));
        std::fprintf(stderr,
                     "WARNING: Unable to keep up with sampling interval. Increasing interval to %.3gs.\n",
                     static_cast<double>(interval_) / nanosecondsPerSecond);
        timer_->setTimer(interval_, interval_, leeway_);
    }
}

void Sampler::takeSample(std::uint64_t ticks) {
    const std::uint64_t now = clock_uptime_raw_approx_ns();
    if (ticks >= 2) {
        stretchInterval(now);
    }
    lastFireTime_ = now;
    freePlaces_.wait();
    if (isStopping_) {
        return;
    }
    TLProcessTable targets = targetProcessesForArgs(args_, nullptr).value_or(TLProcessTable());
    if (const std::shared_ptr<TLTally> last = lastTally()) {
        carryUnchangedOver(*last, targets);
    }
    const auto tally = std::make_shared<TLTally>(processesOf(targets));
    tally->qualityOfService = QOS_CLASS_USER_INITIATED;
    tally->isSample = true;
    {
        const std::lock_guard lock(lastTallyMutex_);
        lastTally_ = tally;
    }
    if (!tally->gatherAllProcesses()) {
        analysisQueue_.async([this, tally] {
            report(*tally);
            freePlaces_.signal();
        });
    }
}

void Sampler::report(TLTally& tally) {
    tally.analyzeMemoryObjects();
    if (!std::exchange(hasReported_, true)) {
        outputs_.leaveOutMapped(tally.processes());
    }
    for (const auto& formatter : outputs_.formatters()) {
        tally.addOutputFormatter(formatter);
    }
    tally.printReport(regionlistLikeOutput_, summarize_);
}

} // namespace

bool runSampling(TLTallyArgs& args, OutputFiles& outputs) {
    std::unique_ptr<Sampler> sampler;
    try {
        sampler = std::make_unique<Sampler>(args, outputs);
    } catch (const std::system_error& refusal) { // no thread, no descriptor
        printLineToStandardError("Unable to start sampling: " + refusal.code().message());
        return false;
    }
    sampler->run();
    return true;
}

} // namespace tally
