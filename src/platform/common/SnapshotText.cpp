#include "platform/common/SnapshotText.h"

#include <algorithm>
#include <cstddef>

namespace tally::platform {

namespace {

// U+10FF80 to U+10FFFF: "\xF4\x8F\xBE\x80" to "\xF4\x8F\xBF\xBF".
constexpr std::string_view escapeLead = "\xF4\x8F";

bool isEscape(std::string_view sequence) {
    return sequence.size() >= 4 && sequence.starts_with(escapeLead) && (sequence[2] & '\x3E') == '\x3E';
}

/// Length of the character at the start of `text`, as strict readers of UTF-8 see it; 0 when there is none.
std::size_t characterLength(std::string_view text) {
    const auto byte = [&](std::size_t at) { return static_cast<unsigned char>(text[at]); };
    const unsigned lead = byte(0);
    const std::size_t length = lead < 0x80   ? 1
                               : lead < 0xC2 ? 0
                               : lead < 0xE0 ? 2
                               : lead < 0xF0 ? 3
                               : lead < 0xF5 ? 4
                                             : 0;
    if (length < 2) {
        return length;
    }
    // The second byte decides on forms that are too long, surrogates and what lies beyond the last character.
    const unsigned lowest = lead == 0xE0 ? 0xA0 : lead == 0xF0 ? 0x90 : 0x80;
    const unsigned highest = lead == 0xED ? 0x9F : lead == 0xF4 ? 0x8F : 0xBF;
    if (text.size() < length || byte(1) < lowest || byte(1) > highest) {
        return 0;
    }
    const bool isWhole = std::all_of(text.begin() + 2, text.begin() + static_cast<std::ptrdiff_t>(length),
                                     [](char c) { return (c & '\xC0') == '\x80'; });
    return isWhole ? length : 0;
}

} // namespace

std::string snapshotTextOfName(std::string_view name) {
    std::string text;
    while (!name.empty()) {
        const std::size_t length = characterLength(name);
        if (length != 0 && !isEscape(name)) {
            text += name.substr(0, length);
            name.remove_prefix(length);
        } else {
            text += escapeLead;
            text += static_cast<char>(0xBE | (static_cast<unsigned char>(name[0]) >> 6 & 1));
            text += static_cast<char>(0x80 | (name[0] & 0x3F));
            name.remove_prefix(1);
        }
    }
    return text;
}

std::string nameOfSnapshotText(std::string_view text) {
    std::string name;
    while (!text.empty()) {
        if (isEscape(text)) {
            name += static_cast<char>(0x80 | (text[2] & 1) << 6 | (text[3] & 0x3F));
            text.remove_prefix(4);
        } else {
            name += text[0];
            text.remove_prefix(1);
        }
    }
    return name;
}

} // namespace tally::platform
