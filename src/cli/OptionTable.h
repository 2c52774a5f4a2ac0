// The options that the command line knows, as the option scanner takes them.
//
// What an option does is decided in ParseArguments.cpp.

#pragma once

#include "platform/system.h"

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

inline constexpr const char* shortOptions = "aj:htp:x:svf:yw";

inline constexpr std::array longOptions = {
    platform::LongOption{"all", false, 'a'},
    platform::LongOption{"json", true, 'j'},
    platform::LongOption{"benchlog", true, optionBenchlog},
    platform::LongOption{"help", false, 'h'},
    platform::LongOption{"targetChildren", false, 't'},
    platform::LongOption{"proc", true, optionProc},
    platform::LongOption{"exclude", true, 'x'},
    platform::LongOption{"pid", true, optionPid},
    platform::LongOption{"skip", false, 's'},
    platform::LongOption{"forkCorpse", false, optionForkCorpse},
    platform::LongOption{"format", true, 'f'},
    platform::LongOption{"sort", true, optionSort},
    platform::LongOption{"summary", false, 'y'},
    platform::LongOption{"physTally", false, optionPhysTally},
    platform::LongOption{"vmObjectDirty", false, optionVmObjectDirty},
    platform::LongOption{"wide", false, 'w'},
    platform::LongOption{"swapped", false, optionSwapped},
    platform::LongOption{"wired", false, optionWired},
    platform::LongOption{"unmapped", false, optionUnmapped},
    platform::LongOption{"sample", true, optionSample},
};

/// `text` with its ASCII letters in lower case: sort columns are shown and compared so.
inline std::string lowerCased(std::string_view text) {
    std::string lower(text);
    std::ranges::transform(lower, lower.begin(), [](unsigned char c) { return std::tolower(c); });
    return lower;
}

} // namespace tally
