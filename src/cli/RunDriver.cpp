#include "cli/RunDriver.h"

#include "cli/OutputFiles.h"
#include "cli/ParseArguments.h"
#include "cli/Sampling.h"
#include "cli/TargetBuilding.h"
#include "cli/Usage.h"
#include "platform/system.h"

#include <atomic>
#include <cstdio>
#include <memory>
#include <new>
#include <utility>

namespace tally {

namespace {

void printMessage(const std::optional<TLError>& error) {
    if (error && !error->message.empty()) {
        std::fprintf(stderr, "%s\n", error->message.c_str());
    }
}

/// The targets of the run; empty, with a message, when there is nothing to measure.
TLTally::ProcessList buildTargets(TLTallyArgs& args) {
    std::optional<TLError> error;
    const std::optional<TLProcessTable> table = targetProcessesForArgs(args, &error);
    if (!table) {
        printMessage(error);
        printUsage();
        return {};
    }
    if (table->empty()) {
        std::fputs(
            "Unable to find any processes matching the supplied process names or pids (try as root?)\n",
            stderr);
        return {};
    }
    printMessage(error);
    return processesOf(*table);
}

/// Whoever ends a run, by an interrupt or, where it writes files, by a signal that would end it, gets the
/// report on what is gathered and whole files. At a terminal that begins with the report of a run that writes
/// files.
class Interrupts {
  public:
    Interrupts(TLTally& tally, const OutputFiles& outputs) : tally_(tally), outputs_(outputs) {
        if (!platform::standardOutputIsTerminal()) {
            listen();
        }
    }
    ~Interrupts() { stopListening(); }
    Interrupts(const Interrupts&) = delete;
    Interrupts& operator=(const Interrupts&) = delete;

    void beginReport() {
        isGathered_ = true;
        if (!hasFiles_) {
            stopListening();
        } else if (!source_) {
            listen();
        }
    }

  private:
    void listen() {
        source_ = TLTally::installSigintHandler([this] { meet(); },
                                                hasFiles_ ? platform::InterruptSignals::sigintAndTermination
                                                          : platform::InterruptSignals::sigint);
    }
    void stopListening() {
        if (source_) {
            source_->cancel();
            platform::restoreDefaultInterruptAction();
            source_.reset();
        }
    }
    void meet() {
        if (hasFiles_) {
            platform::restoreDefaultInterruptAction(); // the next signal ends the run
            outputs_.stopWaitingForReader();
        }
        tally_.earlyExit = true;
        std::fputs(isGathered_ ? "Finishing the output files\n" : "Exiting early due to SIGINT\n", stderr);
    }

    TLTally& tally_;
    const OutputFiles& outputs_;
    const bool hasFiles_ = outputs_.hasFiles();
    std::atomic<bool> isGathered_ = false;
    std::unique_ptr<platform::SignalSource> source_;
};

/// @return whether all of the report is where it belongs.
bool measureOnce(const TLTallyArgs& args, TLTally& tally, OutputFiles& outputs) {
    Interrupts interrupts(tally, outputs);
    tally.gatherAllProcesses();
    tally.analyzeMemoryObjects();
    interrupts.beginReport();
    outputs.leaveOutMapped(tally.processes());
    for (const auto& formatter : outputs.formatters()) {
        tally.addOutputFormatter(formatter);
    }
    tally.printReport(args.regionlistLikeOutput, args.summarize);
    return outputs.close();
}

/// Measures what `args` ask for, into `outputs`. @return whether all of it could be told.
bool measure(TLTallyArgs& args, OutputFiles& outputs, std::unique_ptr<TLTally>& gathered) {
    TLTally::ProcessList targets = buildTargets(args);
    if (targets.empty()) {
        outputs.discard();
        return false;
    }
    if (args.sampleInterval == 0) {
        gathered = std::make_unique<TLTally>(std::move(targets));
        return measureOnce(args, *gathered, outputs);
    }
    targets.clear(); // every sample has its own
    if (!runSampling(args, outputs)) {
        outputs.discard();
        return false;
    }
    return outputs.close();
}

} // namespace

int runTally(int argc, char** argv, std::unique_ptr<TLTally>& gathered) {
    platform::prepareOwnProcess();
    auto parsed = parseArguments(argc, argv);
    if (const auto* error = std::get_if<TLError>(&parsed)) {
        printMessage(*error);
        printUsage();
        return error->isHelp() ? 0 : 1;
    }
    auto& args = std::get<TLTallyArgs>(parsed);
    if (args.shouldGetPhysTallyBreakdown) {
        TLTally::setPhysTallyCollectionEnabled(1);
    }
    if ((args.targetAll || args.searchForUnmapped) && platform::effectiveUserId() != 0) {
        std::fputs("Must run as root.\n", stderr);
        return 1;
    }
    OutputFiles outputs;
    if (!outputs.create(args)) {
        outputs.discard();
        return 1;
    }
    try {
        return measure(args, outputs, gathered) ? 0 : 1;
    } catch (const std::bad_alloc&) {
        outputs.discard(); // half a document is of no use
        throw;
    }
}

int runTally(int argc, char** argv) {
    std::unique_ptr<TLTally> gathered;
    return runTally(argc, argv, gathered);
}

} // namespace tally
