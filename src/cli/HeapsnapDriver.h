// The companion program that writes the snapshot of a running process to a file.

#pragma once

namespace tally {

/// Runs heapsnap with its command line. @return the exit status.
int runHeapsnap(int argc, char** argv);

} // namespace tally
