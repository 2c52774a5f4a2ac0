// The tool's own process: standard streams, user, terminal.

#include "platform/system.h"

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <csignal>

namespace tally::platform {

void prepareOwnProcess() {
    for (const int number : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO}) {
        if (fcntl(number, F_GETFD) == -1) {
            // The lowest free number is given, and all below this one are taken.
            [[maybe_unused]] const int opened =
                open("/dev/null", number == STDIN_FILENO ? O_RDONLY : O_WRONLY);
        }
    }
    std::signal(SIGPIPE, SIG_IGN);
    std::signal(SIGXFSZ, SIG_IGN); // a file that may not grow any more is an error of its writing
    // Tables of a large process grow and go one after the other. Given back and asked for again, each page of
    // theirs costs a fault: a fifth of the run for 100,000 mappings.
    mallopt(M_MMAP_THRESHOLD, 32 << 20); // the most that is allowed
    mallopt(M_TRIM_THRESHOLD, 64 << 20);
}

void endWithClosedPipe() { std::signal(SIGPIPE, SIG_DFL); }

bool standardOutputIsTerminal() { return isatty(STDOUT_FILENO) == 1; }

std::uint32_t effectiveUserId() { return geteuid(); }

std::int32_t ownPid() { return getpid(); }

bool hasInternalContent(const char* /*subsystem*/) { return false; }

} // namespace tally::platform
