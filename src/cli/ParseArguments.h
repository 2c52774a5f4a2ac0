// From the argument vector to the options of a run.
//
// Names, pids and snapshot paths are only collected here; TargetBuilding.h tells them apart.

#pragma once

#include "base/TLError.h"
#include "cli/TLTallyArgs.h"

#include <variant>

namespace tally {

/// Reads the options in their order and then every other argument; `argv` gets permuted. The first option in
/// error ends the reading. Warnings go to standard error at once.
/// @return the options, or an error that the caller prints.
std::variant<TLTallyArgs, TLError> parseArguments(int argc, char** argv);

} // namespace tally
