// Image data: the segments of everything that a task has loaded.

#pragma once

#include "vm/WalkedTask.h"

namespace tally {

/// Lists the image segments of `task` into its walk, sorted by start.
void gatherImageData(WalkedTask& task);

} // namespace tally
