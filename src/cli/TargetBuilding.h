// Target building: from the options to the processes that a run analyzes.
//
// Snapshots come first, because they may fix the analysis mode; then names and pids, exclusions, children and
// corpses. A single target that cannot be analyzed is said on standard error and ends nothing.

#pragma once

#include "base/TLError.h"
#include "cli/TLTallyArgs.h"
#include "process/TargetSelection.h"

#include <memory>
#include <optional>
#include <vector>

namespace tally {

/// Builds the target table. Changes `args`: what is recognised moves to `targetPids` or leaves
/// `potentialTargetProcesses`, and a snapshot fixes the analysis mode.
/// @param error when wanted: why it failed, if that can be told; with a table, what could not be resolved.
/// @return the table, which may be empty; absent when target building failed.
std::optional<TLProcessTable> targetProcessesForArgs(TLTallyArgs& args, std::optional<TLError>* error);

/// The processes of `table`, in no order that means something.
std::vector<std::shared_ptr<TLProcess>> processesOf(const TLProcessTable& table);

} // namespace tally
