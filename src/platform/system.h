// The tool's own process: option scanning, its standard streams, who runs it.

#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

struct LongOption {
    const char* name = nullptr;
    bool takesArgument = false;
    int value = 0; // what next() returns for it
};

/// Scans an argument vector as getopt_long does, permuting it; writes its own diagnostics to standard error.
/// One scan at a time.
class OptionScanner {
  public:
    OptionScanner(int argc, char** argv, const char* shortOptions, std::span<const LongOption> longOptions);
    ~OptionScanner();
    OptionScanner(const OptionScanner&) = delete;
    OptionScanner& operator=(const OptionScanner&) = delete;

    static constexpr int End = -1;
    static constexpr int Unknown = '?'; // an unknown option or a missing argument

    /// The next option's letter or value, Unknown or End.
    int next();
    /// The argument of the option just returned; null when it has none.
    const char* argument() const;
    /// Index of the first argument that is no option, once next() has returned End.
    int index() const;

  private:
    struct State;
    State* state_;
};

/// To be called first: opens descriptors 0, 1 and 2 on the null device where they are closed, so that no file
/// of ours takes their place, ignores the signals of a closed pipe and of a file that is too large, and has
/// freed memory kept for what comes next.
void prepareOwnProcess();
/// Lets the signal of a closed pipe end the program again.
void endWithClosedPipe();

/// What the machine lacks for processes to be measured, as a message; empty when it lacks nothing.
std::string whatMeasuringLacks();

bool standardOutputIsTerminal();
std::uint32_t effectiveUserId();
std::int32_t ownPid();

/// Whether internal content is installed for the tool's subsystem.
bool hasInternalContent(const char* subsystem);

} // namespace tally::platform
