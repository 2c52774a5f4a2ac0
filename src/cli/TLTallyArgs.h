// TLTallyArgs: the options of one run.
//
// Filled by the command line; building the targets then moves what it recognises from the strings to the pids
// and fixes the analysis mode. Afterwards only read.

#pragma once

#include "output/TLOutputFormatterText.h"
#include "process/TargetSelection.h"

#include <cstdint>
#include <optional>
#include <set>
#include <string>

namespace tally {

struct TLTallyArgs {
    bool targetChildren = false;       // every descendant of a target is a target too
    bool targetAll = false;            // every process is a target
    bool skipIdleExitClean = false;    // leave out targets that are tracked for idle exit and clean
    bool regionlistLikeOutput = false; // list every region
    bool summarize = true;             // file memory under its name, not under its full name
    /// The analysis mode: memory as the kernel charges it to the task, or dirty memory as VM objects see it.
    bool shouldGetPhysTallyBreakdown = true;
    bool didSetShouldGetPhysTallyBreakdown = false; // the mode was chosen, by option or by a snapshot
    bool searchForUnmapped = false; // search all other processes for memory that the targets own
    bool forkCorpse = false;        // analyze a corpse of each live target instead of the target
    bool excludeSelf = true;        // the tool itself is no target
    TLSummaryFormat summaryFormat = TLSummaryFormat::formatted;
    std::int64_t textOptions = 0; // TLTextOption... bits
    std::string textSort{TLOutputFormatterText::textSortColumns().front()};
    std::optional<std::string> JSONOutputFile;
    std::optional<std::string> benchlogOutputFile;
    TLTargetPids targetPids;
    std::set<std::string>
        potentialTargetProcesses; // names, pids in text and snapshot paths, not told apart yet
    std::set<std::string> excludedPidsOrProcesses; // names and pids in text
    double sampleInterval = 0;                     // seconds; 0: one report
};

} // namespace tally
