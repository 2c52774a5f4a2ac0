#include "platform/common/SnapshotText.h"

#include "base/Format.h"

#include <cstddef>

namespace tally::platform {

namespace {

// U+10FF80 to U+10FFFF: "\xF4\x8F\xBE\x80" to "\xF4\x8F\xBF\xBF".
constexpr std::string_view escapeLead = "\xF4\x8F";

bool isEscape(std::string_view sequence) {
    return sequence.size() >= 4 && sequence.starts_with(escapeLead) && (sequence[2] & '\x3E') == '\x3E';
}

} // namespace

std::string snapshotTextOfName(std::string_view name) {
    std::string text;
    while (!name.empty()) {
        const std::size_t length = utf8SequenceLength(name);
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
