// CategoryTable: one description of the columns serves titles, rows and totals.

#include "output/CategoryTable.h"

#include "base/Assertion.h"
#include "base/BatchEnumeration.h"

#include <algorithm>
#include <array>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace tally {

namespace {

struct Column {
    const char* title;
    std::size_t widthFormatted;
    std::size_t widthOtherwise;
    std::int64_t option; // the option that shows it; 0: always shown
    std::uint64_t (*value)(const TLMemoryTotals& row);
};

constexpr std::array<Column, 5> columns = {{
    {"Dirty", 7, 11, 0, [](const TLMemoryTotals& row) { return row.charged(); }},
    {"(Swapped)", 11, 14, TLTextOptionSwapped, [](const TLMemoryTotals& row) { return row.swapped; }},
    {"Clean", 11, 14, 0, [](const TLMemoryTotals& row) { return row.clean; }},
    {"Reclaimable", 13, 14, 0, [](const TLMemoryTotals& row) { return row.reclaimable; }},
    {"(Wired)", 11, 14, TLTextOptionWired, [](const TLMemoryTotals& row) { return row.wired; }},
}};

void appendRightAligned(std::string& line, std::string_view text, std::size_t width) {
    line.append(width - std::min(width, text.size()), ' ');
    line += text;
}

/// Prints one line; `cellOf(column)` gives the text of a sized column.
template <typename CellOf>
void printLine(std::FILE* output, const ValueFormat& format, CellOf cellOf, std::string_view regions,
               std::string_view category) {
    const bool isFormatted = format.summaryFormat == TLSummaryFormat::formatted;
    std::string line;
    for (const Column& column : columns) {
        if (column.option == 0 || format.shows(column.option)) {
            appendRightAligned(line, cellOf(column),
                               isFormatted ? column.widthFormatted : column.widthOtherwise);
        }
    }
    line += ' ';
    appendRightAligned(line, regions, 10);
    line += "    ";
    line += category;
    line += '\n';
    std::fwrite(line.data(), 1, line.size(), output);
}

void printDashLine(std::FILE* output, const ValueFormat& format) {
    printLine(
        output, format, [](const Column&) { return "---"; }, "---", "---");
}

void printRow(std::FILE* output, const ValueFormat& format, const TLMemoryTotals& row,
              const std::string& category) {
    printLine(
        output, format,
        [&](const Column& column) {
            return format.formatValue(static_cast<std::int64_t>(column.value(row)));
        },
        std::to_string(static_cast<std::int32_t>(row.regions)), category);
}

/// What rows are sorted by, the largest first; what is equal stays in the order of keys.
using SortKey = std::array<std::uint64_t, 3>;

SortKey sortKey(const TLMemoryTotals& row, std::string_view sort) {
    if (sort == "Dirty") {
        return {row.charged(), row.reclaimable, row.clean};
    }
    if (sort == "Swapped") {
        return {row.swapped};
    }
    if (sort == "Clean") {
        return {row.clean};
    }
    if (sort == "Reclaimable") {
        return {row.reclaimable};
    }
    if (sort == "Wired") {
        return {row.wired};
    }
    if (sort == "Regions") {
        return {row.regions};
    }
    tl_assert(sort == "Category", "Unhandled text sort column");
    return {};
}

struct Row {
    SortKey sortKey;
    const TLCategoryDictionary::value_type* entry;
};

std::vector<Row> sortedRows(const TLCategoryDictionary& categories, std::string_view sort) {
    std::vector<Row> rows;
    rows.reserve(categories.size());
    for (const auto& entry : categories) {
        rows.push_back({sortKey(entry.second.totals, sort), &entry});
    }
    std::ranges::stable_sort(rows, std::ranges::greater(), &Row::sortKey);
    return rows;
}

} // namespace

void printCategoryTable(std::FILE* output, const ValueFormat& format, const TLCategoryDictionary& categories,
                        std::string_view sort, bool verbose) {
    printLine(
        output, format, [](const Column& column) { return column.title; }, "Regions", "Category");
    printDashLine(output, format);
    const std::vector<Row> rows = sortedRows(categories, sort);
    tl_enumerateObjectsWithBatchSize(std::span(rows), 32, [&](std::span<const Row> batch) {
        for (const Row& row : batch) {
            const auto& [key, category] = *row.entry;
            const auto& object = category.firstMemoryObject();
            if (!verbose && object && object->verbose()) {
                continue;
            }
            const Name name = category.name();
            printRow(output, format, category.totals,
                     format.displayName(name.isNull() ? key : name.view(), category.detailedName()));
        }
    });
}

void printTotalRow(std::FILE* output, const ValueFormat& format, const TLMemoryTotals& total) {
    printDashLine(output, format);
    printRow(output, format, total, "TOTAL");
}

} // namespace tally
