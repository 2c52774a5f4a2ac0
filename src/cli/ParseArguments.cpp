#include "cli/ParseArguments.h"

#include "base/Format.h"
#include "cli/OptionTable.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <string_view>
#include <utility>

namespace tally {

namespace {

std::optional<TLError> failure(int code, std::string message = {}) {
    return TLError{TLTallyErrorDomain, code, std::move(message)};
}

std::optional<TLError> setFormat(TLTallyArgs& args, std::string_view value) {
    constexpr std::array<std::pair<std::string_view, TLSummaryFormat>, 3> formats = {{
        {"bytes", TLSummaryFormat::bytes},
        {"formatted", TLSummaryFormat::formatted},
        {"pages", TLSummaryFormat::pages},
    }};
    for (const auto& [name, format] : formats) {
        if (value == name) {
            args.summaryFormat = format;
            return std::nullopt;
        }
    }
    return failure(TLErrorBadFormat, "Unrecognized argument to -f / --format.\n"
                                     "Accepted arguments: 'bytes', 'formatted', 'pages'.");
}

std::optional<TLError> setSort(TLTallyArgs& args, const char* value) {
    const std::string wanted = lowerCased(value);
    std::string accepted;
    for (const std::string_view column : TLOutputFormatterText::textSortColumns()) {
        const std::string name = lowerCased(column);
        if (name == wanted) {
            args.textSort = column;
            return std::nullopt;
        }
        accepted += (accepted.empty() ? "" : ", ") + name;
    }
    return failure(TLErrorBadSort, formatted("Unrecognized argument '%s' to --sort.\nAccepted arguments: %s",
                                             printable(value).c_str(), accepted.c_str()));
}

/// Takes the number that `value` begins with.
std::optional<TLError> addPid(TLTallyArgs& args, const char* value) {
    char* end = nullptr;
    const long long pid = std::strtoll(value, &end, 10); // one that is too large becomes the largest
    if (end == value) {
        return failure(TLErrorBadPid, formatted("'%s' is not a valid integer for --pid.\n\nUse -p / --proc "
                                                "if you meant to specify a process name.",
                                                printable(value).c_str()));
    }
    if (!std::in_range<std::int32_t>(pid)) {
        return failure(TLErrorBadPid,
                       formatted("'%s' is out of the range of pids.", printable(value).c_str()));
    }
    args.targetPids[static_cast<std::int32_t>(pid)] = std::nullopt;
    return std::nullopt;
}

/// The decimal number at the start of `text`, after white space and a sign; 0 when there is none that a
/// double can hold. strtod would take hexadecimal numbers too.
double leadingDecimal(std::string_view text) {
    text.remove_prefix(std::min(text.find_first_not_of(" \t\n\v\f\r"), text.size()));
    if (text.starts_with('+')) {
        text.remove_prefix(1);
    }
    double value = 0;
    std::from_chars(text.data(), text.data() + text.size(), value);
    return value;
}

std::optional<TLError> setSampleInterval(TLTallyArgs& args, const char* value) {
    const double seconds = leadingDecimal(value);
    if (!std::isnormal(seconds) || seconds < 0) {
        return failure(TLErrorBadInterval,
                       formatted("Invalid sampling interval '%s'", printable(value).c_str()));
    }
    args.sampleInterval = seconds;
    return std::nullopt;
}

/// Applies one option to `args`.
std::optional<TLError> applyOption(TLTallyArgs& args, int option, const char* argument) {
    switch (option) {
    case 'a':
        args.targetAll = true;
        break;
    case 'j':
        args.JSONOutputFile = argument;
        break;
    case optionBenchlog:
        args.benchlogOutputFile = argument;
        break;
    case 'h':
        return failure(TLErrorHelp);
    case 't':
        args.targetChildren = true;
        break;
    case 'p':
    case optionProc:
        args.potentialTargetProcesses.insert(argument);
        break;
    case 'x':
        args.excludedPidsOrProcesses.insert(argument);
        break;
    case optionPid:
        return addPid(args, argument);
    case 's':
        args.skipIdleExitClean = true;
        break;
    case optionForkCorpse:
        args.forkCorpse = true;
        break;
    case 'v':
        args.regionlistLikeOutput = true;
        args.summarize = false;
        break;
    case 'f':
        return setFormat(args, argument);
    case optionSort:
        return setSort(args, argument);
    case 'y':
        std::fputs("WARNING: -y/--summary options are deprecated because summary is the default mode\n",
                   stderr);
        break;
    case optionPhysTally:
        std::fputs("WARNING: --physTally option is deprecated because it is the default mode\n", stderr);
        break;
    case optionVmObjectDirty:
        args.shouldGetPhysTallyBreakdown = false;
        args.didSetShouldGetPhysTallyBreakdown = true;
        break;
    case 'w':
        args.textOptions |= TLTextOptionWired | TLTextOptionSwapped | TLTextOptionWide;
        break;
    case optionSwapped:
        args.textOptions |= TLTextOptionSwapped;
        break;
    case optionWired:
        args.textOptions |= TLTextOptionWired;
        break;
    case optionUnmapped:
        args.searchForUnmapped = true;
        break;
    case optionSample:
        return setSampleInterval(args, argument);
    default: // the scanner has said what is wrong
        return failure(TLErrorBadOption);
    }
    return std::nullopt;
}

/// Settles what options mean together, once all of them are known.
std::optional<TLError> combineOptions(TLTallyArgs& args) {
    if (args.forkCorpse && args.targetAll) {
        return failure(TLErrorCorpseOfAll,
                       "--forkCorpse is not compatible with -a/--all due to corpse resource limits");
    }
    if (!args.shouldGetPhysTallyBreakdown && args.searchForUnmapped) {
        std::fputs("WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' "
                   "does not support unmapped owned VM objects\n",
                   stderr);
        args.searchForUnmapped = false;
    } else if (args.targetAll && args.searchForUnmapped) {
        std::fputs("NOTICE: '--unmapped' is redundant when using -a/--all\n", stderr);
        args.searchForUnmapped = false;
    }
    return std::nullopt;
}

} // namespace

std::variant<TLTallyArgs, TLError> parseArguments(int argc, char** argv) {
    TLTallyArgs args;
    beginOptionScan();
    for (int option = 0; (option = nextOption(argc, argv, shortOptions, longOptions.data())) != -1;) {
        if (auto error = applyOption(args, option, optarg)) {
            return *std::move(error);
        }
    }
    if (auto error = combineOptions(args)) {
        return *std::move(error);
    }
    args.potentialTargetProcesses.insert(argv + optind, argv + argc);
    return args;
}

} // namespace tally
