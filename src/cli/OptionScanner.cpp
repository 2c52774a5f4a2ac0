#include "cli/OptionScanner.h"

#include "base/Format.h"

#include <cstdlib>
#include <string>
#include <string_view>

namespace tally {

namespace {

constexpr int missingArgument = ':';
constexpr int unknownOption = '?';

/// What is wrong with the argument just scanned, for which getopt_long gave `result`.
std::string diagnosis(int result, std::string_view word, const option* longOptions) {
    const std::string quoted = "option '" + std::string(word) + "'";
    const std::string letter = std::string(" -- '") + static_cast<char>(optopt) + "'";
    if (result == missingArgument) {
        return word.starts_with("--") ? quoted + " requires an argument"
                                      : "option requires an argument" + letter;
    }
    const auto hasLongOption = [&](auto&& isMeant) {
        const option* known = longOptions;
        while (known->name != nullptr && !isMeant(*known)) {
            ++known;
        }
        return known->name != nullptr;
    };
    if (optopt != 0) {
        return hasLongOption([](const option& known) { return known.val == optopt; })
                   ? quoted + " doesn't allow an argument"
                   : "invalid option" + letter;
    }
    const std::string_view name = word.substr(2, word.find('=') - 2);
    return hasLongOption([&](const option& known) { return std::string_view(known.name).starts_with(name); })
               ? quoted + " is ambiguous"
               : "unrecognized " + quoted;
}

} // namespace

void beginOptionScan() {
    unsetenv("POSIXLY_CORRECT"); // the command line alone decides, and options may follow names
    optind = 0;                  // its permutation included
    opterr = 0;
}

int nextOption(int argc, char** argv, const char* shortOptions, const option* longOptions) {
    optarg = nullptr;
    const int result = getopt_long(argc, argv, shortOptions, longOptions, nullptr);
    if (result != unknownOption && result != missingArgument) {
        return result;
    }
    // The word is the one scanned; but of letters only with the last one of a word.
    printLineToStandardError(std::string(argv[0]) + ": " + diagnosis(result, argv[optind - 1], longOptions));
    return unknownOption;
}

} // namespace tally
