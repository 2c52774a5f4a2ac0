#include "cli/GuardedMain.h"

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

} // namespace

int guardedMain(int (*program)(int argc, char** argv), int argc, char** argv) {
    std::set_terminate(endAtOnce);
    try {
        return program(argc, argv);
    } catch (const std::exception&) {
        explain();
        return 1;
    }
}

} // namespace tally
