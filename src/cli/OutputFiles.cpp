#include "cli/OutputFiles.h"

#include "base/Format.h"
#include "output/TLOutputFormatterBenchlog.h"
#include "output/TLOutputFormatterJSON.h"
#include "output/TLOutputFormatterText.h"
#include "process/TLHeapsnapProcess.h"

#include <algorithm>
#include <cstdio>
#include <system_error>
#include <utility>

namespace tally {

namespace {

/// Whether `output`, where it is asked for, is none of the files that are read. A message has gone to
/// standard error otherwise.
bool isNoInput(const std::optional<std::string>& output, const TLTallyArgs& args) {
    const bool isInput =
        output && std::ranges::any_of(args.potentialTargetProcesses, [&](const std::string& text) {
            return platform::isOneFile(*output, text);
        });
    if (isInput) {
        printLineToStandardError("What is to be read cannot be written to: " + *output);
    }
    return !isInput;
}

} // namespace

std::shared_ptr<TLProcess> processThatMaps(const std::string& path,
                                           std::span<const std::shared_ptr<TLProcess>> processes) {
    const std::optional<platform::FileInMemory> file = platform::fileInMemory(path);
    if (!file) {
        return nullptr;
    }
    const auto showsFile = [&](const TLMemoryRegion& region) { return region.object_id == file->object; };
    const auto found = std::ranges::find_if(processes, [&](const std::shared_ptr<TLProcess>& process) {
        const bool isRunning = dynamic_cast<const TLHeapsnapProcess*>(process.get()) == nullptr;
        // No object stands behind what is untouched, which only the process itself can tell then.
        return isRunning && (std::ranges::any_of(process->memoryRegions(), showsFile) ||
                             platform::mapsFile(process->pid(), *file));
    });
    return found == processes.end() ? nullptr : *found;
}

bool OutputFiles::create(const TLTallyArgs& args) {
    try {
        text_ = std::make_unique<platform::StandardOutput>();
        add(std::make_shared<TLOutputFormatterText>(args.summaryFormat, args.textOptions, args.textSort,
                                                    text_->stream()));
    } catch (const std::bad_alloc&) {
        std::fputs("Unable to initialize text output\n", stderr);
        return false;
    }
    if (!isNoInput(args.JSONOutputFile, args) || !isNoInput(args.benchlogOutputFile, args)) {
        return false;
    }
    if (args.JSONOutputFile &&
        !add(TLOutputFormatterJSON::create(*args.JSONOutputFile), *args.JSONOutputFile)) {
        std::fputs("Unable to create JSON output\n", stderr);
        return false;
    }
    if (args.benchlogOutputFile && !createBenchlog(args)) {
        std::fputs("Unable to create benchlog output\n", stderr);
        return false;
    }
    return true;
}

bool OutputFiles::createBenchlog(const TLTallyArgs& args) {
    const std::string& path = *args.benchlogOutputFile;
    if (args.JSONOutputFile && platform::isOneFile(*args.JSONOutputFile, path)) {
        printLineToStandardError("The JSON document and the performance data cannot share a file: " + path);
        return false;
    }
    return add(TLOutputFormatterBenchlog::create(path), path);
}

bool OutputFiles::add(std::shared_ptr<TLOutputFormatter> formatter, std::string file) {
    if (!formatter) {
        return false;
    }
    formatters_.push_back(std::move(formatter));
    paths_.push_back(std::move(file));
    return true;
}

bool OutputFiles::hasFiles() const {
    return std::ranges::any_of(paths_, [](const std::string& path) { return !path.empty(); });
}

void OutputFiles::leaveOutMapped(std::span<const std::shared_ptr<TLProcess>> processes) {
    for (std::size_t i = formatters_.size(); i-- > 0;) {
        const auto mapper = paths_[i].empty() ? nullptr : processThatMaps(paths_[i], processes);
        if (mapper) {
            printLineToStandardError(mapper->displayString() + " maps " + paths_[i] +
                                     ", which is not written");
            formatters_.erase(formatters_.begin() + static_cast<std::ptrdiff_t>(i));
            paths_.erase(paths_.begin() + static_cast<std::ptrdiff_t>(i));
            isLeftOut_ = true;
        }
    }
}

void OutputFiles::stopWaitingForReader() const {
    if (text_) {
        text_->stopWaiting();
    }
}

bool OutputFiles::close() const {
    bool isComplete = !isLeftOut_;
    for (std::size_t i = 0; i < formatters_.size(); ++i) {
        if (const int error = formatters_[i]->close(); error != 0) {
            isComplete = false;
            printLineToStandardError("Unable to write all of " + paths_[i] +
                                     ", which is incomplete: " + std::generic_category().message(error));
        }
    }
    if (const int error = text_ ? text_->error() : 0; error != 0) {
        isComplete = false;
        printLineToStandardError("Unable to write all of the report to standard output: " +
                                 std::generic_category().message(error));
    }
    return isComplete;
}

void OutputFiles::spareEarlier() const {
    for (const auto& formatter : formatters_) {
        formatter->spareEarlier();
    }
}

void OutputFiles::discard() const {
    for (const auto& formatter : formatters_) {
        formatter->discard();
    }
}

} // namespace tally
