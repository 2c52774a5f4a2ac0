// TLOutputFormatterText: the report as fixed-width text tables.
//
// Names come from other processes: their control characters are shown as "?". Write errors are ignored.

#pragma once

#include "output/ValueFormat.h"
#include "report/TLOutputFormatter.h"

#include <cstdint>
#include <cstdio>
#include <optional>
#include <span>
#include <string>
#include <string_view>

namespace tally {

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
    /// A report on a single process needs no sums over all.
    bool isSummaryShown() const { return processCount_ != 1; }
    void printSeparator() const;
    void printTable(const Categories& categories, const TLMemoryTotals& total) const;

    std::uint8_t processCount_ = 0; // headers in this report: 0, 1, or 2 for more
    bool multipleOutputs_ = false;
    bool verbose_ = false; // set by a region listing, never cleared
    ValueFormat format_;   // its page size is that of the last process
    std::string sort_;
    std::FILE* output_; // not owned
};

} // namespace tally
