// Small steps for decoding the kernel's text: each takes what it read off the front of the text.

#pragma once

#include <charconv>
#include <cstdint>
#include <string_view>

namespace tally::platform {

/// Takes the text up to `end` and `end` itself; all of it when `end` does not occur.
inline std::string_view takeUntil(std::string_view& text, char end) {
    const std::size_t at = text.find(end);
    const std::string_view taken = text.substr(0, at);
    text.remove_prefix(at == std::string_view::npos ? text.size() : at + 1);
    return taken;
}

inline std::string_view takeLine(std::string_view& text) { return takeUntil(text, '\n'); }

inline void skipBlanks(std::string_view& text) {
    while (!text.empty() && (text.front() == ' ' || text.front() == '\t')) {
        text.remove_prefix(1);
    }
}

/// Takes the next word, bounded by blanks.
inline std::string_view takeWord(std::string_view& text) {
    skipBlanks(text);
    const std::size_t end = text.find_first_of(" \t");
    const std::string_view word = text.substr(0, end);
    text.remove_prefix(word.size());
    return word;
}

/// Takes an unsigned number after blanks. @return false, with `*value` untouched, when there is none or it is
/// too large.
template <typename Integer>
bool takeNumber(std::string_view& text, Integer* value, int base = 10) {
    skipBlanks(text);
    const auto result = std::from_chars(text.data(), text.data() + text.size(), *value, base);
    if (result.ec != std::errc()) {
        return false;
    }
    text.remove_prefix(static_cast<std::size_t>(result.ptr - text.data()));
    return true;
}

/// Reads a row "Key:   12 kB" as `*key` and bytes; a number without "kB" stays what it is.
/// @return false, with `*number` untouched, when there is no number.
inline bool readRow(std::string_view line, std::string_view* key, std::uint64_t* number) {
    *key = takeUntil(line, ':');
    if (!takeNumber(line, number)) {
        return false;
    }
    *number *= takeWord(line) == "kB" ? 1024 : 1;
    return true;
}

/// Takes `expected` off the front. @return whether it was there.
inline bool takeChar(std::string_view& text, char expected) {
    if (text.empty() || text.front() != expected) {
        return false;
    }
    text.remove_prefix(1);
    return true;
}

} // namespace tally::platform
