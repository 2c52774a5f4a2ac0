// TLError: the failure of a whole run, or of opening one snapshot, as a value.
//
// Failures of single processes are texts of that process and never a TLError.

#pragma once

#include <string>

namespace tally {

inline constexpr const char* TLTallyErrorDomain = "TLTallyError";
inline constexpr const char* TallyErrorDomain = "TallyErrorDomain"; // the snapshot reader's

/// What ended (or, for code 4 of target building, only partly failed) a run. The codes of TLTallyErrorDomain:
enum TLTallyErrorCode : int {
    TLErrorNoRecord = 0,         // the options record could not be created
    TLErrorHelp = 1,             // help was asked for; the only one with exit status 0
    TLErrorBadFormat = 2,        // --format
    TLErrorBadSort = 3,          // --sort
    TLErrorBadPid = 4,           // --pid, or targets that could not be resolved
    TLErrorBadOption = 5,        // unknown option or missing argument
    TLErrorSnapshotConflict = 6, // a snapshot's analysis mode, or --unmapped with a snapshot
    TLErrorBadSnapshot = 7,      // a path that is neither a snapshot nor a process
    TLErrorNoTargets = 8,        // nothing to analyse
    TLErrorBadInterval = 9,      // --sample
    TLErrorCorpseOfAll = 10,     // --forkCorpse with --all
};

struct TLError {
    std::string domain = TLTallyErrorDomain;
    int code = 0;
    std::string message; // empty: there is none to print

    bool isHelp() const { return domain == TLTallyErrorDomain && code == TLErrorHelp; }
};

} // namespace tally
