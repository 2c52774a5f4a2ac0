// The options that the command line knows, as the option scanner takes them.
//
// What an option does is decided in ParseArguments.cpp.

#pragma once

#include "cli/OptionScanner.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <string>
#include <string_view>

namespace tally {

// Values of the long options that have no letter: above every letter.
enum LongOnlyOption : int {
    optionBenchlog = 0x100,
    optionProc,
    optionPid,
    optionForkCorpse,
    optionSort,
    optionPhysTally,
    optionVmObjectDirty,
    optionSwapped,
    optionWired,
    optionUnmapped,
    optionSample,
};

inline constexpr const char* shortOptions = ":aj:htp:x:svf:yw";

inline constexpr std::array longOptions = {
    option{"all", no_argument, nullptr, 'a'},
    option{"json", required_argument, nullptr, 'j'},
    option{"benchlog", required_argument, nullptr, optionBenchlog},
    option{"help", no_argument, nullptr, 'h'},
    option{"targetChildren", no_argument, nullptr, 't'},
    option{"proc", required_argument, nullptr, optionProc},
    option{"exclude", required_argument, nullptr, 'x'},
    option{"pid", required_argument, nullptr, optionPid},
    option{"skip", no_argument, nullptr, 's'},
    option{"forkCorpse", no_argument, nullptr, optionForkCorpse},
    option{"format", required_argument, nullptr, 'f'},
    option{"sort", required_argument, nullptr, optionSort},
    option{"summary", no_argument, nullptr, 'y'},
    option{"physTally", no_argument, nullptr, optionPhysTally},
    option{"vmObjectDirty", no_argument, nullptr, optionVmObjectDirty},
    option{"wide", no_argument, nullptr, 'w'},
    option{"swapped", no_argument, nullptr, optionSwapped},
    option{"wired", no_argument, nullptr, optionWired},
    option{"unmapped", no_argument, nullptr, optionUnmapped},
    option{"sample", required_argument, nullptr, optionSample},
    option{}, // the end
};

/// `text` with its ASCII letters in lower case: sort columns are shown and compared so.
inline std::string lowerCased(std::string_view text) {
    std::string lower(text);
    std::ranges::transform(lower, lower.begin(), [](unsigned char c) { return std::tolower(c); });
    return lower;
}

} // namespace tally
