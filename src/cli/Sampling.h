// Sampling: one measurement after another at an interval, until an interrupt.
//
// A sample resolves the targets anew and gathers them on a timer's queue; its analysis and report follow on a
// queue of their own, in the order of the samples, while the next one may already be gathered.

#pragma once

#include "cli/OutputFiles.h"
#include "cli/TLTallyArgs.h"

namespace tally {

/// Measures every `args.sampleInterval` seconds into `outputs`, and returns after an interrupt, once
/// everything gathered before it is reported. Each building of targets changes `args`.
/// Without a sample that was completed, files that held something before stay as they are, with a message.
/// @return false, with a message, when the system refuses what sampling needs.
bool runSampling(TLTallyArgs& args, OutputFiles& outputs);

} // namespace tally
