// GuardedMain: how a program ends that could not go on, in whichever of its threads.

#pragma once

#include <functional>

namespace tally {

/// Runs `program`. What it, or a thread of it, throws is a message on standard error and the exit status 1:
/// lack of memory or of threads, in the first place. So is what it leaves for standard output and that does
/// not take.
/// @return the exit status.
int guardedMain(const std::function<int(int argc, char** argv)>& program, int argc, char** argv);

} // namespace tally
