#include "cli/GuardedMain.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <new>
#include <stdexcept>

namespace tally {

namespace {

/// Says what the exception that is being handled means. Needs no memory.
void explain() {
    try {
        throw;
    } catch (const std::bad_alloc&) {
        std::fputs("Not enough memory to go on\n", stderr);
    } catch (const std::length_error&) { // of what would not fit into any memory
        std::fputs("Not enough memory to go on\n", stderr);
    } catch (const std::exception& error) {
        std::fprintf(stderr, "Unable to go on: %s\n", error.what());
    }
}

/// For threads that nobody waits for.
[[noreturn]] void endAtOnce() {
    if (std::current_exception()) {
        explain();
        std::_Exit(1);
    }
    std::abort();
}

/// Whether what stands in buffers could be written, or nobody reads it any more; a message has gone to
/// standard error otherwise.
bool finishOutput() {
    if (std::fflush(stdout) == 0 || errno == EPIPE) {
        return true;
    }
    std::perror("Unable to write to standard output");
    return false;
}

} // namespace

int guardedMain(const std::function<int(int argc, char** argv)>& program, int argc, char** argv) {
    std::set_terminate(endAtOnce);
    try {
        const int status = program(argc, argv);
        return finishOutput() ? status : 1;
    } catch (const std::exception&) {
        explain();
        return 1;
    }
}

} // namespace tally
