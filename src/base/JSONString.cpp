#include "base/JSONString.h"

#include "base/Format.h"

#include <algorithm>

namespace tally {

namespace {

constexpr std::string_view replacementCharacter = "\xef\xbf\xbd";

bool isPlain(char c) { return c >= 0x20 && c < 0x7f && c != '"' && c != '\\'; }

std::string escaped(unsigned char character) {
    switch (character) {
    case '"':
        return "\\\"";
    case '\\':
        return "\\\\";
    case '\b':
        return "\\b";
    case '\f':
        return "\\f";
    case '\n':
        return "\\n";
    case '\r':
        return "\\r";
    case '\t':
        return "\\t";
    default:
        return formatted("\\u%04x", character);
    }
}

/// Whether `sequence`, of two bytes, is one of the control characters U+0080 to U+009F.
bool isHighControl(std::string_view sequence) {
    return sequence[0] == '\xc2' && static_cast<unsigned char>(sequence[1]) < 0xa0;
}

} // namespace

void appendJSONString(std::string& document, std::string_view text) {
    document += '"';
    while (!text.empty()) {
        const auto* const plainEnd = std::find_if_not(text.begin(), text.end(), isPlain);
        document.append(text.begin(), plainEnd);
        text.remove_prefix(static_cast<std::size_t>(plainEnd - text.begin()));
        if (text.empty()) {
            break;
        }
        const std::size_t length = utf8SequenceLength(text);
        if (length == 0) {
            document += replacementCharacter;
        } else if (length == 1 || (length == 2 && isHighControl(text))) {
            document += escaped(static_cast<unsigned char>(text[length - 1]));
        } else {
            document += text.substr(0, length);
        }
        text.remove_prefix(std::max<std::size_t>(length, 1));
    }
    document += '"';
}

std::string DistinctKeys::keyFor(std::string_view name) {
    const auto written = [](std::string_view text) {
        std::string quoted;
        appendJSONString(quoted, text);
        return quoted;
    };
    const auto [met, isNew] = lastNumbers_.try_emplace(written(name), 1);
    int& lastNumber = met->second; // stays where it is, as the iterator does not
    std::string key(name);
    for (bool isTaken = !isNew; isTaken; isTaken = !lastNumbers_.try_emplace(written(key), 1).second) {
        key = std::string(name) + " (" + std::to_string(++lastNumber) + ")";
    }
    return key;
}

} // namespace tally
