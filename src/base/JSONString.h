// JSON strings: how any bytes are written into a document that stays valid JSON.

#pragma once

#include <string>
#include <string_view>

namespace tally {

/// Appends `text` to `document` as a quoted JSON string. Quotes, backslashes and all control characters
/// (U+0000 to U+001F, U+007F to U+009F) are escaped; a byte that is not UTF-8 becomes U+FFFD.
void appendJSONString(std::string& document, std::string_view text);

} // namespace tally
