// Names as text of a JSON document, which must be UTF-8, while names of files and processes are any bytes.
//
// A byte that is no part of UTF-8 stands as the private character U+10FF00 plus its value, and so does each
// byte of a name that has such a character itself. Every name comes back as it was.

#pragma once

#include <string>
#include <string_view>

namespace tally::platform {

std::string snapshotTextOfName(std::string_view name);
std::string nameOfSnapshotText(std::string_view text);

} // namespace tally::platform
