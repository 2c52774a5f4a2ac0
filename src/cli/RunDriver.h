// The run driver: one run of the program, from its arguments to its exit status.

#pragma once

#include "analysis/TLTally.h"

#include <memory>

namespace tally {

/// Runs the tool. @param gathered out: what a report was made of, which is much and in small pieces: a
/// program that ends need not free it.
/// @return the exit status: 0 after a report or help, 1 after an error of the whole run.
int runTally(int argc, char** argv, std::unique_ptr<TLTally>& gathered);

/// The same, and frees what it has gathered.
int runTally(int argc, char** argv);

} // namespace tally
