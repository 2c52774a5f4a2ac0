#include "cli/Usage.h"

#include "cli/OptionTable.h"
#include "output/TLOutputFormatterText.h"
#include "platform/system.h"

#include <cstdio>

namespace tally {

void printUsage() {
    std::printf(
        "Gather memory information about a process or set of processes\n"
        "Usage: tally [args] [proc/pid/heapsnap [proc/pid/heapsnap [...]]]\n"
        "    -a, --all                             target all processes\n"
        "    -j, --json <file>                     print json output to a file\n"
        "    -h, --help                            print this output\n"
        "    -p, --proc, --pid [proc/pid]          target pid or process (or interpret for -p)\n"
        "    -x, --exclude [proc/pid]              exclude pid or process\n"
        "    -s, --skip                            skip processes that are idle-exit clean\n"
        "    --forkCorpse                          analyze a forked corpse of the target process (not "
        "compatible with --all)\n"
        "    -v                                    print all regions and regionlist-like output of address "
        "space layout (default output is a summary)\n"
        "    -f, --format (bytes|formatted|pages)  change size formatting preference (default: formatted)\n"
        "    --sort <column>                       change the column used for sorting (default: %s)\n"
        "    -w, --wide                            show wide output with all columns and full paths (implies "
        "--swapped --wired)\n"
        "    --swapped                             show swapped/compressed column\n"
        "    --wired                               show wired column\n"
        "    --vmObjectDirty                       interpret dirty memory as viewed by VM objects in the "
        "kernel\n"
        "    --unmapped                            search all processes for unmapped memory owned by the "
        "target processes\n"
        "    --sample <interval>                   repeatedly gather tally at the given sampling interval in "
        "seconds (can be fractional — e.g. 0.5)\n",
        lowerCased(TLOutputFormatterText::textSortColumns().front()).c_str());
    if (platform::hasInternalContent(subsystemIdentifier)) {
        std::printf("\nKestrelInternal:\n"
                    "    --benchlog <file.blj>                 print benchlog(1) output to a file\n");
    }
}

} // namespace tally
