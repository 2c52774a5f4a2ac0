// JSONWriter: the text of a JSON document, made piece by piece in the order of its parts; compact.
//
// Knows where commas stand, and nothing of what the document says. The text made so far can be taken away at
// any time, so a document may be larger than memory.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

namespace tally {

class JSONWriter {
  public:
    void beginObject() { begin('{'); }
    void endObject() { end('}'); }
    void beginArray() { begin('['); }
    void endArray() { end(']'); }
    /// The key of the value that follows.
    void key(std::string_view key);

    void string(std::string_view text);
    void number(std::uint64_t value);
    void signedNumber(std::int64_t value);
    void fixedNumber(double value); // with six decimals
    void boolean(bool value) { element(value ? "true" : "false"); }
    void null() { element("null"); }
    /// A value that is written already.
    void element(std::string_view json);

    /// The text since it was last taken away.
    const std::string& text() const { return text_; }
    std::string takeText() { return std::exchange(text_, {}); }
    void clearText() { text_.clear(); }

  private:
    void separate();
    void begin(char bracket);
    void end(char bracket);

    std::string text_;
    bool needsComma_ = false; // before the next key, value or opening bracket
};

} // namespace tally
