// Option scanning: getopt_long with diagnostics of our own, since its own would bring any byte of the
// arguments to the terminal. Its state is the whole process's: one scan at a time. `optarg` is the argument
// of the option just returned, null when it has none; `optind`, after the last one, the index of the first
// argument that is no option.

#pragma once

#include <getopt.h>

namespace tally {

/// Forgets an earlier scan. To be called before each one.
void beginOptionScan();
/// The next option's letter or value; '?' for an unknown option or a missing argument, after a line on
/// standard error; -1 at the end. @param shortOptions begin with ':'. @param longOptions end with an empty
/// record.
int nextOption(int argc, char** argv, const char* shortOptions, const option* longOptions);

} // namespace tally
