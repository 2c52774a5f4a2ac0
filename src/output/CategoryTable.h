// CategoryTable: the one table layout of the text report, for a process, a group and the summary.
//
// Decides columns, order and visibility of rows. Rows that compare equal are in the order of their keys, so
// that equal input gives equal text.

#pragma once

#include "analysis/TLMemoryCategory.h"
#include "output/ValueFormat.h"

#include <cstdio>
#include <string_view>

namespace tally {

/// Prints the header and a row per category, sorted by the column named `sort`. Rows of reserved areas are
/// left out unless `verbose`.
void printCategoryTable(std::FILE* output, const ValueFormat& format, const TLCategoryDictionary& categories,
                        std::string_view sort, bool verbose);

/// Prints the closing row.
void printTotalRow(std::FILE* output, const ValueFormat& format, const TLMemoryTotals& total);

} // namespace tally
