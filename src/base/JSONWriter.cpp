#include "base/JSONWriter.h"

#include "base/Format.h"
#include "base/JSONString.h"

namespace tally {

void JSONWriter::separate() {
    if (needsComma_) {
        text_ += ',';
    }
    needsComma_ = true;
}

void JSONWriter::begin(char bracket) {
    separate();
    text_ += bracket;
    needsComma_ = false;
}

void JSONWriter::end(char bracket) {
    text_ += bracket;
    needsComma_ = true;
}

void JSONWriter::key(std::string_view key) {
    separate();
    appendJSONString(text_, key);
    text_ += ':';
    needsComma_ = false;
}

void JSONWriter::string(std::string_view text) {
    separate();
    appendJSONString(text_, text);
}

void JSONWriter::number(std::uint64_t value) { element(std::to_string(value)); }

void JSONWriter::signedNumber(std::int64_t value) { element(std::to_string(value)); }

void JSONWriter::fixedNumber(double value) { element(formatted("%f", value)); }

void JSONWriter::element(std::string_view json) {
    separate();
    text_ += json;
}

} // namespace tally
