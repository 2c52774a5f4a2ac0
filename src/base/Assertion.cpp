#include "base/Assertion.h"

#include <cstdio>
#include <cstdlib>
#include <string_view>

namespace tally {

void failAssertion(const char* expression, std::source_location where) {
    std::string_view file = where.file_name();
    file.remove_prefix(file.rfind('/') + 1);
    std::fprintf(stderr, "Assertion failed: (%s), function %s, file %.*s, line %u.\n", expression,
                 where.function_name(), static_cast<int>(file.size()), file.data(), where.line());
    std::abort();
}

} // namespace tally
