// The text report, call by call. Its wording and spacing are read by scripts.

#include "output/TLOutputFormatterText.h"

#include "analysis/TLProcessGroup.h"
#include "base/Format.h"
#include "output/CategoryTable.h"
#include "output/RegionListing.h"
#include "platform/clock.h"
#include "process/TLProcess.h"
#include "report/TLTime.h"
#include "vm/PhysTallyCollection.h"

#include <array>
#include <utility>

namespace tally {

namespace {

// A group of more processes is shown by its size instead of its members' names.
constexpr std::size_t mostProcessesListed = 20;

void printIndented(std::FILE* output, std::string_view text) {
    std::fprintf(output, "\t%s\n", printable(text).c_str());
}

void printNames(std::FILE* output, const char* introduction, const TLOutputFormatter::Processes& processes) {
    if (processes.empty()) {
        return;
    }
    std::fputs(introduction, output);
    for (const auto& process : processes) {
        printIndented(output, process->name());
    }
}

void printTexts(std::FILE* output, const char* introduction, const std::vector<std::string>& texts) {
    if (texts.empty()) {
        return;
    }
    std::fputs(introduction, output);
    for (const std::string& text : texts) {
        printIndented(output, text);
    }
}

void printAuxEntries(std::FILE* output, const ValueFormat& format, const TLAuxDictionary& dictionary,
                     int indent) {
    for (const auto& [key, datum] : dictionary.entries) {
        std::fprintf(output, "%s%s:", std::string(indent, '\t').c_str(), printable(key).c_str());
        if (datum.isContainer()) {
            std::fputc('\n', output);
            printAuxEntries(output, format, datum.dictionary(), indent + 1);
        } else {
            std::fprintf(output, " %s\n", format.formatValue(datum.leaf().value()).c_str());
        }
    }
}

void printAuxBlock(std::FILE* output, const ValueFormat& format, const TLAuxDictionary& auxData) {
    std::fputs("Auxiliary data:\n", output);
    printAuxEntries(output, format, auxData, 1);
    std::fputc('\n', output);
}

} // namespace

TLOutputFormatterText::TLOutputFormatterText(TLSummaryFormat summaryFormat, std::int64_t options,
                                             std::string sort, std::FILE* output)
    : format_{summaryFormat, options}, sort_(std::move(sort)), output_(output) {}

std::span<const std::string_view> TLOutputFormatterText::textSortColumns() {
    static constexpr std::array<std::string_view, 7> names = {"Dirty", "Swapped", "Clean",   "Reclaimable",
                                                              "Wired", "Regions", "Category"};
    return names;
}

void TLOutputFormatterText::startAtTime(const std::optional<TLTime>& time) {
    processCount_ = 0;
    const auto date = TLTime::date(time);
    if (multipleOutputs_ && date) {
        std::fprintf(output_, "Time: %s\n", platform::iso8601LocalDate(*date).c_str());
    }
}

void TLOutputFormatterText::printRegionlistLikeOutputForProcess(const TLProcess& process,
                                                                std::span<const TLMemoryRegion> regions) {
    verbose_ = true;
    printRegionListing(output_, format_, process, regions);
}

void TLOutputFormatterText::printSeparator() const {
    const std::size_t optionalColumns = format_.shows(TLTextOptionSwapped) + format_.shows(TLTextOptionWired);
    std::fprintf(output_, "%s\n", std::string(70 + 10 * optionalColumns, '=').c_str());
}

void TLOutputFormatterText::printProcessHeader(const TLProcess& process) {
    if (processCount_ < 2) {
        ++processCount_;
    }
    format_.pageSize = process.pageSize();
    printSeparator();
    std::fprintf(output_, "%s: %s-bit%s", printable(process.displayString()).c_str(),
                 process.is64bit() ? "64" : "32", process.isTranslated() ? " (translated)" : "");
    printTexts(output_, "\nWarnings were encountered while examining the process.\n", process.warnings());
    printTexts(output_, "\nErrors were encountered while examining the process. No results gathered.\n",
               process.errors());
}

void TLOutputFormatterText::printProcessTotal(std::optional<std::uint64_t> total, const TLProcess& process) {
    std::fprintf(output_, "\tTally: %s (%lu bytes per page)\n",
                 format_.formatValue(static_cast<std::int64_t>(total.value_or(0))).c_str(),
                 static_cast<unsigned long>(process.pageSize()));
}

void TLOutputFormatterText::endProcessHeader(const TLProcess& /*process*/) {
    printSeparator();
    std::fputc('\n', output_);
}

void TLOutputFormatterText::printTable(const Categories& categories, const TLMemoryTotals& total) const {
    printCategoryTable(output_, format_, categories, sort_, verbose_);
    printTotalRow(output_, format_, total);
}

void TLOutputFormatterText::printProcessCategories(const Categories& categories,
                                                   const TLMemoryTotals& total) {
    printTable(categories, total);
    std::fputc('\n', output_);
}

void TLOutputFormatterText::printSharedCategories(const Categories& categories,
                                                  const TLProcessGroup& sharedWith, const TLProcess& process,
                                                  bool /*hasProcessView*/, const TLMemoryTotals& total) {
    const std::size_t count = sharedWith.processes().size();
    if (count > mostProcessesListed) {
        std::fprintf(output_, "Shared with %zu processes:\n", count);
    } else {
        const char* separator = "";
        std::fputs("Shared with", output_);
        for (const auto& member : sharedWith.processes()) {
            if (!(*member == process)) {
                std::fprintf(output_, "%s %s", separator, printable(member->displayString()).c_str());
                separator = ",";
            }
        }
        std::fputs(":\n", output_);
    }
    printTable(categories, total);
    std::fputc('\n', output_);
}

void TLOutputFormatterText::printProcessAuxData(const std::optional<TLAuxDictionary>& auxData) {
    if (auxData) {
        printAuxBlock(output_, format_, *auxData);
    }
}

void TLOutputFormatterText::printProcessesWithWarnings(const Processes& processesWithWarnings,
                                                       const Processes& processesWithErrors,
                                                       const std::vector<std::string>& globalErrors) {
    printNames(output_, "\nWarnings were encountered while examining the following processes:\n",
               processesWithWarnings);
    printNames(output_, "\nErrors were encountered while examining the following processes:\n",
               processesWithErrors);
    printTexts(output_, "\nErrors were encountered:\n", globalErrors);
    if (!processesWithErrors.empty() || !globalErrors.empty()) {
        std::fputs("\nDue to errors, summary results may be invalid\n", output_);
    }
}

void TLOutputFormatterText::printSummaryCategories(const Categories& categories, const TLMemoryTotals& total,
                                                   bool hadErrors) {
    if (!physTallyCollectionEnabled()) {
        std::fputs("VM Object Dirty Analysis: Enabled\n", output_);
    }
    if (!isSummaryShown()) {
        return;
    }
    printSeparator();
    std::fprintf(output_, "Summary Tally: %s%s\n",
                 format_.formatValue(static_cast<std::int64_t>(total.charged())).c_str(),
                 hadErrors ? " (may be invalid due to errors)" : "");
    printSeparator();
    std::fputc('\n', output_);
    printTable(categories, total);
}

void TLOutputFormatterText::printGlobalAuxData(const std::optional<TLAuxDictionary>& auxData) {
    if (!isSummaryShown()) {
        return;
    }
    std::fputc('\n', output_);
    if (auxData) {
        printAuxBlock(output_, format_, *auxData);
    }
}

void TLOutputFormatterText::endAtTime(const std::optional<TLTime>& /*time*/) { std::fflush(output_); }

} // namespace tally
