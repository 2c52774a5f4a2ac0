// The JSON report, call by call. Its keys and their order are read by programs.

#include "output/TLOutputFormatterJSON.h"

#include "analysis/TLProcessGroup.h"
#include "base/BatchEnumeration.h"
#include "base/JSONString.h"
#include "platform/clock.h"
#include "process/TLProcess.h"
#include "report/TLTime.h"
#include "vm/PhysTallyCollection.h"

#include <cstdio>
#include <utility>

namespace tally {

namespace {

// The file gets the document in pieces of about this size.
constexpr std::size_t pieceBytes = 65536;

void writeTexts(JSONWriter& json, const char* key, const std::vector<std::string>& texts) {
    json.key(key);
    json.beginArray();
    for (const std::string& text : texts) {
        json.string(text);
    }
    json.endArray();
}

void writeNumber(JSONWriter& json, const char* key, std::uint64_t value) {
    json.key(key);
    json.number(value);
}

void writeNumberUnlessZero(JSONWriter& json, const char* key, std::uint64_t value) {
    if (value != 0) {
        writeNumber(json, key, value);
    }
}

void writeSizes(JSONWriter& json, const TLMemoryTotals& sizes) {
    json.beginObject();
    writeNumber(json, "dirty", sizes.charged());
    writeNumber(json, "swapped", sizes.swapped);
    writeNumber(json, "clean", sizes.clean);
    writeNumber(json, "reclaimable", sizes.reclaimable);
    writeNumber(json, "wired", sizes.wired);
    writeNumber(json, "regions", sizes.regions);
    json.endObject();
}

void writeCategoryEntries(JSONWriter& json, const TLOutputFormatter::Categories& categories,
                          DistinctKeys keys = {}) {
    for (const auto& [key, category] : categories) {
        json.key(keys.keyFor(category.fullName()));
        writeSizes(json, category.totals);
    }
}

void writeCategories(JSONWriter& json, const TLOutputFormatter::Categories& categories) {
    json.key("categories");
    json.beginObject();
    writeCategoryEntries(json, categories);
    json.endObject();
}

void writeAuxDictionary(JSONWriter& json, const TLAuxDictionary& dictionary) {
    json.beginObject();
    DistinctKeys keys;
    for (const auto& [key, datum] : dictionary.entries) {
        json.key(keys.keyFor(key));
        if (datum.isContainer()) {
            writeAuxDictionary(json, datum.dictionary());
        } else {
            json.signedNumber(datum.leaf().value());
        }
    }
    json.endObject();
}

void writeAuxData(JSONWriter& json, const std::optional<TLAuxDictionary>& auxData) {
    json.key("auxiliary");
    if (auxData) {
        writeAuxDictionary(json, *auxData);
    } else {
        json.null();
    }
}

void writeRegion(JSONWriter& json, const TLMemoryRegion& region) {
    json.beginObject();
    writeNumber(json, "id", region.object_id);
    json.key("name");
    json.string(region.fullName());
    if (region.start != TLNotSet) {
        writeNumber(json, "addr", region.start);
    }
    writeNumber(json, "vsize", region.size);
    writeNumberUnlessZero(json, "offset", region.offset);
    writeNumberUnlessZero(json, "dirty", region.dirtySize);
    writeNumberUnlessZero(json, "swapped", region.swappedSize);
    writeNumberUnlessZero(json, "clean", region.cleanNonSpecSize);
    writeNumberUnlessZero(json, "reclaimable", region.reclaimableSize);
    writeNumberUnlessZero(json, "wired", region.wired ? region.size : 0);
    json.endObject();
}

} // namespace

std::shared_ptr<TLOutputFormatterJSON> TLOutputFormatterJSON::create(const std::string& path) {
    std::unique_ptr<platform::OutputFile> file = platform::OutputFile::open(path);
    if (!file) {
        std::perror("Unable to open JSON writer");
        return nullptr;
    }
    return std::make_shared<TLOutputFormatterJSON>(std::move(file));
}

TLOutputFormatterJSON::TLOutputFormatterJSON(std::unique_ptr<platform::OutputFile> file)
    : file_(std::move(file)) {
    json_.beginObject();
    json_.key("unit");
    json_.string("byte");
    writeNumber(json_, "bytes per unit", 1);
    if (!physTallyCollectionEnabled()) {
        json_.key("vm_object_dirty_analysis");
        json_.boolean(true);
    }
}

void TLOutputFormatterJSON::writeOut(std::size_t leastBytes) {
    if (json_.text().size() >= leastBytes) {
        file_->write(json_.text());
        json_.clearText();
    }
}

void TLOutputFormatterJSON::configureForMultipleOutputs() {
    multipleOutputs_ = true;
    json_.key("samples");
    json_.beginArray();
}

void TLOutputFormatterJSON::writeTime(const char* key, const std::optional<TLTime>& time) {
    json_.key(key);
    json_.beginObject();
    writeNumber(json_, "mach_absolute_time_ns", TLTime::absoluteTimeNs(time));
    writeNumber(json_, "mach_continuous_time_ns", TLTime::continuousTimeNs(time));
    json_.key("wall_time_s");
    json_.fixedNumber(time ? time->wallTime() : 0);
    json_.key("date");
    if (const auto date = TLTime::date(time)) {
        json_.string(platform::iso8601LocalDate(*date, 'T'));
    } else {
        json_.null();
    }
    json_.endObject();
}

void TLOutputFormatterJSON::startAtTime(const std::optional<TLTime>& time) {
    if (multipleOutputs_) {
        json_.beginObject();
    }
    writeTime("start_time", time);
    json_.key("processes");
    json_.beginArray();
    shared_ = {};
    addedProcessGroups_ = {};
}

void TLOutputFormatterJSON::printRegionlistLikeOutputForProcess(const TLProcess& /*process*/,
                                                                std::span<const TLMemoryRegion> /*regions*/) {
    verbose_ = true;
}

void TLOutputFormatterJSON::writeRegions(const TLProcess& process) {
    json_.key("regions");
    json_.beginArray();
    tl_enumerateObjectsWithBatchSize(std::span(process.memoryRegions()), 128,
                                     [&](std::span<const TLMemoryRegion> batch) {
                                         for (const TLMemoryRegion& region : batch) {
                                             writeRegion(json_, region);
                                         }
                                         writeOut(pieceBytes);
                                     });
    json_.endArray();
}

void TLOutputFormatterJSON::printProcessHeader(const TLProcess& process) {
    json_.beginObject();
    json_.key("name");
    json_.string(process.name());
    json_.key("pid");
    json_.signedNumber(process.pid());
    json_.key("translated");
    json_.boolean(process.isTranslated());
    writeNumber(json_, "page size", process.pageSize());
    if (process.hasErrors()) {
        writeTexts(json_, "errors", process.errors());
    }
    if (!process.warnings().empty()) {
        writeTexts(json_, "warnings", process.warnings());
    }
    if (verbose_) {
        writeRegions(process);
    }
    if (pageSize_ == 0) {
        pageSize_ = process.pageSize();
    }
}

void TLOutputFormatterJSON::printProcessTotal(std::optional<std::uint64_t> total,
                                              const TLProcess& /*process*/) {
    writeNumber(json_, "tally", total.value_or(0));
}

void TLOutputFormatterJSON::printProcessCategories(const Categories& categories,
                                                   const TLMemoryTotals& /*total*/) {
    writeCategories(json_, categories);
}

void TLOutputFormatterJSON::printSharedCategories(const Categories& categories,
                                                  const TLProcessGroup& sharedWith, const TLProcess& process,
                                                  bool hasProcessView, const TLMemoryTotals& /*total*/) {
    if (!hasProcessView && !addedProcessGroups_.insert(&sharedWith).second) {
        return; // the same sizes are there already
    }
    JSONWriter record;
    record.beginObject();
    record.key("pids");
    record.beginArray();
    for (const auto& member : sharedWith.processes()) {
        record.signedNumber(member->pid());
    }
    record.endArray();
    if (hasProcessView) {
        record.key("specific_to_pid");
        record.signedNumber(process.pid());
    }
    writeCategories(record, categories);
    record.endObject();
    shared_.emplace_back(record.text()); // as long as it is, without room to grow
}

void TLOutputFormatterJSON::printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) {
    writeAuxData(json_, auxData);
    json_.endObject();
    writeOut(pieceBytes);
}

void TLOutputFormatterJSON::printProcessesWithWarnings(const Processes& processesWithWarnings,
                                                       const Processes& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors) {
    json_.endArray();
    std::vector<std::string> errors = globalErrors;
    for (const auto& process : processesWithErrors) {
        const std::vector<std::string> own = process->errors();
        errors.insert(errors.end(), own.begin(), own.end());
    }
    std::vector<std::string> warnings;
    for (const auto& process : processesWithWarnings) {
        const std::string& whose = process->displayString();
        for (const std::string& text : process->warnings()) {
            warnings.push_back(text.starts_with(whose) ? text : whose + ": " + text);
        }
    }
    writeTexts(json_, "errors", errors);
    writeTexts(json_, "warnings", warnings);
}

void TLOutputFormatterJSON::printSummaryCategories(const Categories& categories, const TLMemoryTotals& total,
                                                   bool /*hadErrors*/) {
    json_.key("summary");
    json_.beginObject();
    DistinctKeys keys;
    const std::string sum = keys.keyFor("total"); // whatever a category is called
    writeCategoryEntries(json_, categories, std::move(keys));
    json_.key(sum);
    writeSizes(json_, total);
    json_.endObject();
    writeNumber(json_, "total tally", total.charged());
}

void TLOutputFormatterJSON::printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) {
    writeAuxData(json_, auxData);
}

void TLOutputFormatterJSON::endAtTime(const std::optional<TLTime>& time) {
    json_.key("shared");
    json_.beginArray();
    for (const std::string& record : shared_) {
        json_.element(record);
        writeOut(pieceBytes);
    }
    json_.endArray();
    shared_ = {};
    writeTime("end_time", time);
    if (multipleOutputs_) {
        json_.endObject();
    }
    writeOut(0);
}

int TLOutputFormatterJSON::close() {
    if (multipleOutputs_) {
        json_.endArray();
    }
    writeNumber(json_, "page size", pageSize_ != 0 ? pageSize_ : platform::vm_kernel_page_size());
    json_.endObject();
    writeOut(0);
    return file_->close();
}

} // namespace tally
