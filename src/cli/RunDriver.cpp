#include "cli/RunDriver.h"

#include "analysis/TLTally.h"
#include "cli/OutputFiles.h"
#include "cli/ParseArguments.h"
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

/// The targets of the run; absent, with a message, when there is nothing to measure.
std::optional<TLTally::ProcessList> buildTargets(TLTallyArgs& args) {
    std::optional<TLError> error;
    const std::optional<TLProcessTable> table = targetProcessesForArgs(args, &error);
    if (!table) {
        printMessage(error);
        printUsage();
        return std::nullopt;
    }
    if (table->empty()) {
        std::fputs(
            "Unable to find any processes matching the supplied process names or pids (try as root?)\n",
            stderr);
        return std::nullopt;
    }
    printMessage(error);
    TLTally::ProcessList targets;
    for (const auto& [key, process] : *table) {
        targets.push_back(process);
    }
    return targets;
}

void measureOnce(const TLTallyArgs& args, TLTally::ProcessList targets, const OutputFiles& outputs) {
    TLTally tally(std::move(targets));
    std::unique_ptr<platform::SignalSource> interrupts;
    if (!platform::standardOutputIsTerminal()) {
        interrupts = TLTally::installSigintHandler([&tally] {
            tally.earlyExit = true;
            std::fputs("Exiting early due to SIGINT\n", stderr);
        });
    }
    tally.gatherAllProcesses();
    tally.analyzeMemoryObjects();
    if (interrupts) {
        interrupts->cancel();
        platform::restoreDefaultSigintAction();
    }
    for (const auto& formatter : outputs.formatters()) {
        tally.addOutputFormatter(formatter);
    }
    tally.printReport(args.regionlistLikeOutput, args.summarize);
}

/// Measures what `args` ask for, into `outputs`. @return whether there was something to report.
bool measure(TLTallyArgs& args, const OutputFiles& outputs) {
    std::optional<TLTally::ProcessList> targets = buildTargets(args);
    if (!targets) {
        return false;
    }
    if (args.sampleInterval != 0) {
        std::fputs("Sampling is not available in this build\n", stderr);
        return false;
    }
    measureOnce(args, *std::move(targets), outputs);
    return true;
}

} // namespace

int runTally(int argc, char** argv) {
    platform::prepareStandardStreams();
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
        outputs.deleteFiles();
        return 1;
    }
    outputs.close();
    return 0;
}

} // namespace tally
