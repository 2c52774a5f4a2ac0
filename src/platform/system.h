// The tool's own process: its standard streams, who runs it.

#pragma once

#include <cstdint>
#include <string>

namespace tally::platform {

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
