#include "cli/RunDriver.h"

#include "analysis/TLTally.h"
#include "cli/OutputFiles.h"
#include "cli/ParseArguments.h"
#include "cli/Sampling.h"
#include "cli/TargetBuilding.h"
#include "cli/Usage.h"
#include "platform/system.h"

#include <cstdio>
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

void measureOnce(const TLTallyArgs& args, TLTally::ProcessList targets, const OutputFiles& outputs) {
    TLTally tally(std::move(targets));
    std::unique_ptr<platform::SignalSource> interrupts;
    if (!platform::standardOutputIsTerminal()) {
        const auto exitEarly = [&tally] {
            tally.earlyExit = true;
            std::fputs("Exiting early due to SIGINT\n", stderr);
        };
        // Whoever ends a run that writes files, by whichever signal, wants them whole.
        interrupts = TLTally::installSigintHandler(
            exitEarly, outputs.hasFiles() ? platform::InterruptSignals::sigintAndTermination
                                          : platform::InterruptSignals::sigint);
    }
    tally.gatherAllProcesses();
    tally.analyzeMemoryObjects();
    if (interrupts) {
        interrupts->cancel();
        platform::restoreDefaultInterruptAction();
    }
    for (const auto& formatter : outputs.formatters()) {
        tally.addOutputFormatter(formatter);
    }
    tally.printReport(args.regionlistLikeOutput, args.summarize);
}

/// Measures what `args` ask for, into `outputs`. @return whether there was something to report.
bool measure(TLTallyArgs& args, const OutputFiles& outputs) {
    TLTally::ProcessList targets = buildTargets(args);
    if (targets.empty()) {
        return false;
    }
    if (args.sampleInterval != 0) {
        targets.clear(); // every sample has its own
        return runSampling(args, outputs);
    }
    measureOnce(args, std::move(targets), outputs);
    return true;
}

} // namespace

int runTally(int argc, char** argv) {
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
    if (!outputs.create(args) || !measure(args, outputs)) {
        outputs.discard();
        return 1;
    }
    return outputs.close() ? 0 : 1;
}

} // namespace tally
