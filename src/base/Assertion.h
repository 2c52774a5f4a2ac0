// Assertions: programming errors stop the program with a message, in every build.
//
// Input never reaches one of these: bad input is an error record or a text of a process.

#pragma once

#include <source_location>

namespace tally {

/// Writes "Assertion failed: (<expression>), function <f>, file <file>, line <line>." to standard error and
/// aborts.
[[noreturn]] void failAssertion(const char* expression,
                                std::source_location where = std::source_location::current());

/// Stops the program with `expression` as its message unless `holds`.
inline void tl_assert(bool holds, const char* expression,
                      std::source_location where = std::source_location::current()) {
    if (!holds) [[unlikely]] {
        failAssertion(expression, where);
    }
}

} // namespace tally
