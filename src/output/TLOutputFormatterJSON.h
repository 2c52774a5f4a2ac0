// TLOutputFormatterJSON: the reports as one JSON document in a file; docs/json-format.md describes it.
//
// The document is written while the calls arrive: an object that one call opens is closed by a later one.
// Only what processes share waits for the end of its report.

#pragma once

#include "base/JSONWriter.h"
#include "platform/output_file.h"
#include "report/TLOutputFormatter.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <vector>

namespace tally {

class TLOutputFormatterJSON final : public TLOutputFormatter {
  public:
    /// A formatter that writes to the file of `path`; null, with a message, when that cannot be opened.
    static std::shared_ptr<TLOutputFormatterJSON> create(const std::string& path);
    explicit TLOutputFormatterJSON(std::unique_ptr<platform::OutputFile> file);

    void printProcessHeader(const TLProcess& process) override;
    void endProcessHeader(const TLProcess& /*process*/) override {}
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

    const char* className() const override { return "TLOutputFormatterJSON"; }
    void startAtTime(const std::optional<TLTime>& time) override;
    bool supportsMultipleOutputs() const override { return true; }
    void configureForMultipleOutputs() override;
    int close() override;
    void spareEarlier() override { file_->spareEarlier(); }
    void discard() override { file_->discard(); }
    bool supportsRegionlistLikeOutput() const override { return true; }
    void printRegionlistLikeOutputForProcess(const TLProcess& process,
                                             std::span<const TLMemoryRegion> regions) override;

  private:
    void writeTime(const char* key, const std::optional<TLTime>& time);
    void writeRegions(const TLProcess& process);
    /// Hands the text made so far to the file, where there is enough of it.
    void writeOut(std::size_t leastBytes);

    bool verbose_ = false; // processes carry their regions
    bool multipleOutputs_ = false;
    std::vector<std::string> shared_; // objects of this report, written already
    std::set<const TLProcessGroup*> addedProcessGroups_;
    std::uint64_t pageSize_ = 0; // of the first process; 0: there was none
    JSONWriter json_;
    std::unique_ptr<platform::OutputFile> file_;
};

} // namespace tally
