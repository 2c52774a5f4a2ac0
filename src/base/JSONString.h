// JSON strings: how any bytes are written into a document that stays valid JSON.

#pragma once

#include <string>
#include <string_view>
#include <unordered_map>

namespace tally {

/// Appends `text` to `document` as a quoted JSON string. Quotes, backslashes and all control characters
/// (U+0000 to U+001F, U+007F to U+009F) are escaped; a byte that is not UTF-8 becomes U+FFFD.
void appendJSONString(std::string& document, std::string_view text);

/// Keys of one object whose names come from strangers. Names that read the same once they are written, since
/// not all of their bytes are UTF-8 or they were cut, get a number: "name", "name (2)", in the order of
/// coming.
class DistinctKeys {
  public:
    /// The key for the next name.
    std::string keyFor(std::string_view name);

  private:
    std::unordered_map<std::string, int> lastNumbers_; // by what a reader sees
};

} // namespace tally
