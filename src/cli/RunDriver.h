// The run driver: one run of the program, from its arguments to its exit status.

#pragma once

namespace tally {

/// Runs the tool. @return the exit status: 0 after a report or help, 1 after an error of the whole run.
int runTally(int argc, char** argv);

} // namespace tally
