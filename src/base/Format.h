// Text helpers that every layer needs: printf-style strings, and names made safe for a terminal.

#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace tally {

/// The formatted text as a string.
[[gnu::format(printf, 1, 2)]] std::string formatted(const char* format, ...);

/// Length of the UTF-8 character at the start of `text`, which is not empty; 0 when there is none. Overlong
/// forms, surrogates and what lies beyond U+10FFFF are none.
std::size_t utf8SequenceLength(std::string_view text);

/// Whether all of `text` is UTF-8.
bool isUTF8(std::string_view text);

/// `text` with "?" for every control character (U+0000 to U+001F, U+007F to U+009F), every mark that turns
/// the direction of text or ends a line and every byte that is not UTF-8. A name comes from another process
/// and must not be able to drive the terminal that shows it.
std::string printable(std::string_view text);

/// Writes `printable(message)` and a newline to standard error.
void printLineToStandardError(std::string_view message);

} // namespace tally
