// Performance data, call by call. Metrics are compared across runs by their names.

#include "output/TLOutputFormatterBenchlog.h"

#include "analysis/TLMemoryCategory.h"
#include "process/TLProcess.h"
#include "vm/PhysTallyCollection.h"

#include <cstdio>
#include <utility>

namespace tally {

using namespace platform;

namespace {

constexpr std::size_t longestMetricName = 1023; // bytes
constexpr const char* allProcesses = "ALL_PROCESSES";

} // namespace

std::shared_ptr<TLOutputFormatterBenchlog> TLOutputFormatterBenchlog::create(const std::string& path) {
    BenchlogHandle writer = blwriter_open(
        path, physTallyCollectionEnabled() ? "tally.phys_tally" : "tally.vm_object_dirty", 1, 0);
    if (!writer) {
        std::perror("Unable to open blwriter");
        return nullptr;
    }
    return std::make_shared<TLOutputFormatterBenchlog>(std::move(writer));
}

TLOutputFormatterBenchlog::TLOutputFormatterBenchlog(BenchlogHandle writer) : writer_(std::move(writer)) {
    blwriter_set_description(*writer_, "Memory measurements gathered by the tally(1) tool");
    blwriter_set_primary_metric(*writer_, "total_memory,process=ALL_PROCESSES");
}

void TLOutputFormatterBenchlog::addBytes(const std::string& metric, double bytes,
                                         const std::string& process) {
    blwriter_new_value(*writer_, metrics_.keyFor(metric), blunit_B, bytes);
    blwriter_record_variable_str(*writer_, "process", process);
}

void TLOutputFormatterBenchlog::beginGroup() {
    blwriter_new_group(*writer_);
    metrics_ = {};
}

void TLOutputFormatterBenchlog::printProcessHeader(const TLProcess& process) {
    beginGroup();
    currentProcess_ = process.name();
}

void TLOutputFormatterBenchlog::printProcessTotal(std::optional<std::uint64_t> total,
                                                  const TLProcess& process) {
    addBytes("total_memory", static_cast<double>(total.value_or(0)), process.name());
    blwriter_record_label_str(*writer_, "pid", std::to_string(process.pid()));
    blwriter_record_tag(*writer_, bltag_summary);
}

void TLOutputFormatterBenchlog::addCategoryTotals(const Categories& categories) {
    for (const auto& [key, category] : categories) {
        currentProcessTotals_[category.fullName()] += category.totals.charged();
    }
}

void TLOutputFormatterBenchlog::printProcessCategories(const Categories& categories,
                                                       const TLMemoryTotals& /*total*/) {
    addCategoryTotals(categories);
}

void TLOutputFormatterBenchlog::printSharedCategories(const Categories& categories,
                                                      const TLProcessGroup& /*sharedWith*/,
                                                      const TLProcess& /*process*/, bool /*hasProcessView*/,
                                                      const TLMemoryTotals& /*total*/) {
    addCategoryTotals(categories);
}

void TLOutputFormatterBenchlog::printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) {
    for (const auto& [category, bytes] : std::exchange(currentProcessTotals_, {})) {
        addBytes(category, static_cast<double>(bytes), currentProcess_);
    }
    emitAuxData(auxData, currentProcess_);
}

void TLOutputFormatterBenchlog::emitAuxData(const std::optional<TLAuxDictionary>& auxData,
                                            const std::string& process) {
    if (auxData) {
        emitAuxEntries(*auxData, "aux_data", process);
    }
}

void TLOutputFormatterBenchlog::emitAuxEntries(const TLAuxDictionary& dictionary, const std::string& metric,
                                               const std::string& process) {
    for (const auto& [key, datum] : dictionary.entries) {
        const std::string name = (metric + "." + key).substr(0, longestMetricName);
        if (datum.isContainer()) {
            emitAuxEntries(datum.dictionary(), name, process);
        } else {
            addBytes(name, static_cast<double>(datum.leaf().value()), process);
            blwriter_record_tag(*writer_, bltag_context);
        }
    }
}

void TLOutputFormatterBenchlog::printSummaryCategories(const Categories& categories,
                                                       const TLMemoryTotals& total, bool /*hadErrors*/) {
    beginGroup();
    addBytes("total_memory", static_cast<double>(total.charged()), allProcesses);
    blwriter_record_tag(*writer_, bltag_summary);
    for (const auto& [key, category] : categories) {
        addBytes(category.fullName(), static_cast<double>(category.totals.charged()), allProcesses);
    }
}

void TLOutputFormatterBenchlog::printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) {
    emitAuxData(auxData, allProcesses);
}

void TLOutputFormatterBenchlog::endAtTime(const std::optional<TLTime>& time) {
    const std::uint64_t milliseconds =
        (TLTime::continuousTimeNs(time) - TLTime::continuousTimeNs(startTime_)) / 1'000'000;
    blwriter_new_value(*writer_, "gather_duration", blunit_ms, static_cast<double>(milliseconds));
    blwriter_record_tag(*writer_, bltag_context);
}

} // namespace tally
