// The calls of the platform's headers by name: which of them are meant, and what was asked of them.

#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

/// One call that was made.
struct CallRecord {
    std::string name;
    std::int32_t pid = -1;                // whom it was about; -1: no process
    std::vector<std::uint64_t> arguments; // its numbers, in the order of the call's parameters
    std::string text;                     // its string

    friend bool operator==(const CallRecord&, const CallRecord&) = default;
};

/// Which calls are meant; they are counted from the moment that this is said.
struct CallSelector {
    std::uint64_t nth = 1;             // the first one, from 1
    std::uint64_t times = 1;           // how many in a row
    std::optional<std::int32_t> pid{}; // only those about this process
};
inline constexpr std::uint64_t always = ~std::uint64_t{0}; // a value of `times`

/// Throws std::invalid_argument for a call that does not exist, or cannot fail where it must.
void requireCallName(std::string_view call, bool canFail);

} // namespace tally::platform
