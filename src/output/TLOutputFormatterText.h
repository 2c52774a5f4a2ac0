// TLOutputFormatterText: the report as fixed-width text tables.
//
// Names come from other processes: their control characters are shown as "?". Write errors are ignored.

#pragma once

#include "output/protocol/TLOutputFormatter.h"

#include <cstdint>
#include <cstdio>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace tally {

/// How byte counts are shown.
enum class TLSummaryFormat : std::int64_t { bytes = 0, formatted = 1, pages = 2 };

// Bits of the text options.
inline constexpr std::int64_t TLTextOptionWired = 1;   // show the wired column
inline constexpr std::int64_t TLTextOptionSwapped = 2; // show the swapped column
inline constexpr std::int64_t TLTextOptionWide = 4;    // print paths in full

class TLOutputFormatterText final : public TLOutputFormatter {
  public:
    /// @param sort one of textSortColumns. @param output where to print; not owned.
    TLOutputFormatterText(TLSummaryFormat summaryFormat, std::int64_t options, std::string sort,
                          std::FILE* output = stdout);

    /// The names that --sort accepts, the default first.
    static std::span<const std::string_view> textSortColumns();

    void printProcessHeader(const TLProcess& process) override;
    void endProcessHeader(const TLProcess& process) override;
    void printProcessTotal(std::optional<std::uint64_t> total, const TLProcess& process) override;
    void printProcessCategories(const Categories& categories, const TLMemoryTotals& total) override;
    void printSharedCategories(const Categories& categories, const TLProcessGroup& sharedWith,
                               const TLProcess& process, bool hasProcessView,
                               const TLMemoryTotals& total) override;
    void printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) override;
    void printProcessesWithWarnings(const Processes& processesWithWarnings,
                                    const Processes& processesWithErrors,
                                    const std::vector<std::string>& globalErrors) override;
    void printSummaryCategories(const Categories& categories, const TLMemoryTotals& total,
                                bool hadErrors) override;
    void printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) override;
    void endAtTime(const std::optional<TLTime>& time) override;

    const char* className() const override { return "TLOutputFormatterText"; }
    void startAtTime(const std::optional<TLTime>& time) override;
    bool supportsMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override { multipleOutputs_ = true; }
    bool supportsRegionlistLikeOutput() const override { return true; }
    void printRegionlistLikeOutputForProcess(const TLProcess& process,
                                             std::span<const TLMemoryRegion> regions) override;

  private:
    bool isSummaryShown() const { return processCount_ != 1; }

    std::uint8_t processCount_ = 0; // headers in this report: 0, 1, or 2 for more
    std::uint64_t pageSize_ = 0;    // of the last process, bytes
    bool multipleOutputs_ = false;
    bool verbose_ = false; // set by a region listing, never cleared
    TLSummaryFormat summaryFormat_;
    std::int64_t options_;
    std::string sort_;
    std::FILE* output_; // not owned
};

} // namespace tally
