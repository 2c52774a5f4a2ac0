#include "base/Format.h"

#include <algorithm>
#include <cstdarg>
#include <cstdint>
#include <cstdio>

namespace tally {

std::string formatted(const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    std::va_list again;
    va_copy(again, arguments);
    const int length = std::vsnprintf(nullptr, 0, format, arguments);
    va_end(arguments);
    std::string text(length > 0 ? static_cast<std::size_t>(length) : 0, '\0');
    std::vsnprintf(text.data(), text.size() + 1, format, again);
    va_end(again);
    return text;
}

std::size_t utf8SequenceLength(std::string_view text) {
    const auto lead = static_cast<unsigned char>(text[0]);
    if (lead < 0x80) {
        return 1;
    }
    const std::size_t length = (lead & 0xe0) == 0xc0   ? 2
                               : (lead & 0xf0) == 0xe0 ? 3
                               : (lead & 0xf8) == 0xf0 ? 4
                                                       : 0;
    if (length == 0 || length > text.size()) {
        return 0;
    }
    std::uint32_t character = lead & (0x7fU >> length);
    for (std::size_t i = 1; i < length; ++i) {
        const auto byte = static_cast<unsigned char>(text[i]);
        if ((byte & 0xc0) != 0x80) {
            return 0;
        }
        character = character << 6 | (byte & 0x3f);
    }
    // A longer sequence than a character needs is none: it could hide a control character.
    constexpr std::uint32_t leastOfLength[] = {0, 0, 0x80, 0x800, 0x10000};
    const bool isSurrogate = character >= 0xd800 && character <= 0xdfff;
    return character < leastOfLength[length] || isSurrogate || character > 0x10ffff ? 0 : length;
}

bool isUTF8(std::string_view text) {
    while (!text.empty()) {
        const std::size_t length = utf8SequenceLength(text);
        if (length == 0) {
            return false;
        }
        text.remove_prefix(length);
    }
    return true;
}

namespace {

bool isControl(std::string_view sequence) {
    const auto first = static_cast<unsigned char>(sequence[0]);
    if (sequence.size() == 1) {
        return first < 0x20 || first == 0x7f;
    }
    if (sequence.size() == 2 && first == 0xc2) {
        return static_cast<unsigned char>(sequence[1]) <= 0x9f;
    }
    // U+061C, U+200E, U+200F, U+202A to U+202E and U+2066 to U+2069 turn the direction of text, U+2028 and
    // U+2029 end a line.
    return sequence == "\xd8\x9c" || (sequence >= "\xe2\x80\x8e" && sequence <= "\xe2\x80\x8f") ||
           (sequence >= "\xe2\x80\xa8" && sequence <= "\xe2\x80\xae") ||
           (sequence >= "\xe2\x81\xa6" && sequence <= "\xe2\x81\xa9");
}

} // namespace

std::string printable(std::string_view text) {
    std::string safe;
    safe.reserve(text.size());
    while (!text.empty()) {
        const std::size_t length = utf8SequenceLength(text);
        if (length == 0 || isControl(text.substr(0, length))) {
            safe += '?';
        } else {
            safe += text.substr(0, length);
        }
        text.remove_prefix(std::max<std::size_t>(length, 1));
    }
    return safe;
}

void printLineToStandardError(std::string_view message) {
    const std::string line = printable(message) + "\n";
    std::fwrite(line.data(), 1, line.size(), stderr);
}

} // namespace tally
