// TLOutputFormatterBenchlog: the reports as performance data: a group of metrics per process, one for the
// summary.
//
// Every metric is in bytes but for the time that gathering took.

#pragma once

#include "base/JSONString.h"
#include "platform/benchlog.h"
#include "report/TLOutputFormatter.h"
#include "report/TLTime.h"

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tally {

class TLOutputFormatterBenchlog final : public TLOutputFormatter {
  public:
    /// A formatter that writes to the file of `path`; null, with a message, when that cannot be opened.
    static std::shared_ptr<TLOutputFormatterBenchlog> create(const std::string& path);
    explicit TLOutputFormatterBenchlog(platform::BenchlogHandle writer);

    void printProcessHeader(const TLProcess& process) override;
    void endProcessHeader(const TLProcess& /*process*/) override {}
    void printProcessTotal(std::optional<std::uint64_t> total, const TLProcess& process) override;
    void printProcessCategories(const Categories& categories, const TLMemoryTotals& total) override;
    void printSharedCategories(const Categories& categories, const TLProcessGroup& sharedWith,
                               const TLProcess& process, bool hasProcessView,
                               const TLMemoryTotals& total) override;
    void printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) override;
    void printProcessesWithWarnings(const Processes& /*processesWithWarnings*/,
                                    const Processes& /*processesWithErrors*/,
                                    const std::vector<std::string>& /*globalErrors*/) override {}
    void printSummaryCategories(const Categories& categories, const TLMemoryTotals& total,
                                bool hadErrors) override;
    void printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) override;
    void endAtTime(const std::optional<TLTime>& time) override;

    const char* className() const override { return "TLOutputFormatterBenchlog"; }
    void startAtTime(const std::optional<TLTime>& time) override { startTime_ = time; }
    bool supportsMultipleOutputs() const override { return true; }
    int close() override { return platform::blwriter_close(std::move(writer_)); }
    void spareEarlier() override { platform::blwriter_spare_earlier(*writer_); }
    void discard() override { platform::blwriter_discard(std::move(writer_)); }

  private:
    void beginGroup();
    void addCategoryTotals(const Categories& categories);
    void addBytes(const std::string& metric, double bytes, const std::string& process);
    void emitAuxData(const std::optional<TLAuxDictionary>& auxData, const std::string& process);
    void emitAuxEntries(const TLAuxDictionary& dictionary, const std::string& metric,
                        const std::string& process);

    platform::BenchlogHandle writer_; // null once closed
    DistinctKeys metrics_;            // of the group
    std::string currentProcess_;      // name of the process whose section is being told
    std::map<std::string, std::uint64_t> currentProcessTotals_; // its bytes, by category
    std::optional<TLTime> startTime_;
};

} // namespace tally
