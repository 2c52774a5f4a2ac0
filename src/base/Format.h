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

/// `text` with every control character replaced by "?": bytes below 0x20, 0x7f, and the C1 controls
/// (U+0080 to U+009F, written in UTF-8 or as a lone byte), and marks that turn the direction of text. A name
/// comes from another process and must not be able to drive the terminal that shows it.
std::string printable(std::string_view text);

/// Writes `printable(message)` and a newline to standard error.
void printLineToStandardError(std::string_view message);

} // namespace tally
