// OptionScanner by getopt_long, whose state is the whole process's: one scan at a time.

#include "platform/system.h"

#include <getopt.h>

#include <cstdlib>

namespace tally::platform {

struct OptionScanner::State {
    int argc;
    char** argv;
    std::string shortOptions;
    std::vector<option> longOptions; // ends with an empty record
};

OptionScanner::OptionScanner(int argc, char** argv, const char* shortOptions,
                             std::span<const LongOption> longOptions)
    : state_(new State{argc, argv, shortOptions, {}}) {
    for (const LongOption& known : longOptions) {
        state_->longOptions.push_back(
            {known.name, known.takesArgument ? required_argument : no_argument, nullptr, known.value});
    }
    state_->longOptions.push_back({});
    unsetenv("POSIXLY_CORRECT"); // the command line alone decides, and options may follow names
    optind = 0;                  // forget an earlier scan, its permutation included
    opterr = 1;
}

OptionScanner::~OptionScanner() { delete state_; }

int OptionScanner::next() {
    optarg = nullptr;
    return getopt_long(state_->argc, state_->argv, state_->shortOptions.c_str(), state_->longOptions.data(),
                       nullptr);
}

const char* OptionScanner::argument() const { return optarg; }

int OptionScanner::index() const { return optind; }

} // namespace tally::platform
