#include "cli/OutputFiles.h"

#include "base/Format.h"
#include "output/TLOutputFormatterBenchlog.h"
#include "output/TLOutputFormatterJSON.h"
#include "output/TLOutputFormatterText.h"
#include "platform/output_file.h"

#include <algorithm>
#include <cstdio>
#include <new>
#include <system_error>
#include <utility>

namespace tally {

bool OutputFiles::create(const TLTallyArgs& args) {
    auto* text =
        new (std::nothrow) TLOutputFormatterText(args.summaryFormat, args.textOptions, args.textSort);
    if (!add(std::shared_ptr<TLOutputFormatter>(text))) {
        std::fputs("Unable to initialize text output\n", stderr);
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

bool OutputFiles::close() const {
    bool isComplete = true;
    for (std::size_t i = 0; i < formatters_.size(); ++i) {
        if (const int error = formatters_[i]->close(); error != 0) {
            isComplete = false;
            printLineToStandardError("Unable to write all of " + paths_[i] +
                                     ", which is incomplete: " + std::generic_category().message(error));
        }
    }
    return isComplete;
}

void OutputFiles::discard() const {
    for (const auto& formatter : formatters_) {
        formatter->discard();
    }
}

} // namespace tally
