// ValueFormat: how the text report shows a byte count and a path, and which optional columns it has.

#pragma once

#include "base/Name.h"

#include <cstdint>
#include <string>
#include <string_view>

namespace tally {

/// How byte counts are shown.
enum class TLSummaryFormat : std::int64_t { bytes = 0, formatted = 1, pages = 2 };

// Bits of the text options.
inline constexpr std::int64_t TLTextOptionWired = 1;   // show the wired column
inline constexpr std::int64_t TLTextOptionSwapped = 2; // show the swapped column
inline constexpr std::int64_t TLTextOptionWide = 4;    // print paths in full

struct ValueFormat {
    TLSummaryFormat summaryFormat = TLSummaryFormat::formatted;
    std::int64_t options = 0;
    std::uint64_t pageSize = 0; // bytes; 0 as long as no process has been shown

    bool shows(std::int64_t option) const { return (options & option) != 0; }

    std::string formatValue(std::int64_t bytes) const;
    /// ".../" and the last component of a path that has several, unless paths are shown in full.
    std::string shortenPath(std::string_view path) const;
    /// The two names of a region or a row, the second one shortened, both made safe for a terminal.
    std::string displayName(std::string_view name, Name detailedName) const;
};

/// Whole or partial pages of `bytes`; 0 when the page size is 0.
std::uint64_t pageCount(std::uint64_t bytes, std::uint64_t pageSize);

} // namespace tally
