// OptionScanner by getopt_long, whose state is the whole process's: one scan at a time. The diagnostics are
// ours: its own would bring any byte of the arguments to the terminal.

#include "platform/system.h"

#include "base/Format.h"

#include <getopt.h>

#include <algorithm>
#include <cstdlib>
#include <string_view>

namespace tally::platform {

namespace {

constexpr int missingArgument = ':';

} // namespace

struct OptionScanner::State {
    int argc;
    char** argv;
    std::string shortOptions;
    std::vector<option> longOptions; // ends with an empty record

    /// What is wrong with the argument just scanned, for which getopt_long gave `result`.
    std::string diagnosis(int result) const {
        const std::string_view word = argv[optind - 1]; // but of letters only with the last one of a word
        const std::string quoted = "option '" + std::string(word) + "'";
        const std::string letter = std::string(" -- '") + static_cast<char>(optopt) + "'";
        if (result == missingArgument) {
            return word.starts_with("--") ? quoted + " requires an argument"
                                          : "option requires an argument" + letter;
        }
        const auto isKnown = [](const option& known) { return known.name != nullptr && known.val == optopt; };
        if (optopt != 0) {
            return std::ranges::any_of(longOptions, isKnown) ? quoted + " doesn't allow an argument"
                                                             : "invalid option" + letter;
        }
        const std::string_view name = word.substr(2, word.find('=') - 2);
        const auto isBegun = [&](const option& known) {
            return known.name != nullptr && std::string_view(known.name).starts_with(name);
        };
        return std::ranges::any_of(longOptions, isBegun) ? quoted + " is ambiguous"
                                                         : "unrecognized " + quoted;
    }
};

OptionScanner::OptionScanner(int argc, char** argv, const char* shortOptions,
                             std::span<const LongOption> longOptions)
    : state_(new State{argc, argv, std::string(":") + shortOptions, {}}) {
    for (const LongOption& known : longOptions) {
        state_->longOptions.push_back(
            {known.name, known.takesArgument ? required_argument : no_argument, nullptr, known.value});
    }
    state_->longOptions.push_back({});
    unsetenv("POSIXLY_CORRECT"); // the command line alone decides, and options may follow names
    optind = 0;                  // forget an earlier scan, its permutation included
    opterr = 0;
}

OptionScanner::~OptionScanner() { delete state_; }

int OptionScanner::next() {
    optarg = nullptr;
    const int option = getopt_long(state_->argc, state_->argv, state_->shortOptions.c_str(),
                                   state_->longOptions.data(), nullptr);
    if (option != Unknown && option != missingArgument) {
        return option;
    }
    printLineToStandardError(std::string(state_->argv[0]) + ": " + state_->diagnosis(option));
    return Unknown;
}

const char* OptionScanner::argument() const { return optarg; }

int OptionScanner::index() const { return optind; }

} // namespace tally::platform
