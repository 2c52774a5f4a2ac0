// Assertions: programming errors stop the program with a message, in every build.
//
// Input never reaches one of these: bad input is an error record or a text of a process.

#pragma once

namespace tally {

/// Writes "Assertion failed: (<expression>), function <f>, file <file>, line <line>." to standard error and
/// aborts. The place is the caller's. (std::source_location is not known to every compiler that reads this.)
[[noreturn]] void failAssertion(const char* expression, const char* function = __builtin_FUNCTION(),
                                const char* file = __builtin_FILE(), unsigned line = __builtin_LINE());

/// Stops the program with `expression` as its message unless `holds`.
inline void tl_assert(bool holds, const char* expression, const char* function = __builtin_FUNCTION(),
                      const char* file = __builtin_FILE(), unsigned line = __builtin_LINE()) {
    if (!holds) [[unlikely]] {
        failAssertion(expression, function, file, line);
    }
}

} // namespace tally
