#include "base/Assertion.h"

#include <cstdio>
#include <cstdlib>
#include <string_view>

namespace tally {

void failAssertion(const char* expression, const char* function, const char* file, unsigned line) {
    std::string_view name = file;
    name.remove_prefix(name.rfind('/') + 1);
    std::fprintf(stderr, "Assertion failed: (%s), function %s, file %.*s, line %u.\n", expression, function,
                 static_cast<int>(name.size()), name.data(), line);
    std::abort();
}

} // namespace tally
