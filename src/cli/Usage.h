// The usage text.

#pragma once

namespace tally {

/// The tool's name to the platform, under which it asks for internal content and labels its queues.
inline constexpr const char* subsystemIdentifier = "org.tally";

/// Writes the usage text to standard output.
void printUsage();

} // namespace tally
