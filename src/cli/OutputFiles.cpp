#include "cli/OutputFiles.h"

#include "output/TLOutputFormatterText.h"

#include <cstdio>
#include <filesystem>
#include <new>
#include <system_error>
#include <utility>

namespace tally {

namespace {

// This build has no formatter for either file.
std::shared_ptr<TLOutputFormatter> createJSONFormatter(const std::string& /*path*/) { return nullptr; }
std::shared_ptr<TLOutputFormatter> createBenchlogFormatter(const std::string& /*path*/) { return nullptr; }

} // namespace

bool OutputFiles::create(const TLTallyArgs& args) {
    auto* text =
        new (std::nothrow) TLOutputFormatterText(args.summaryFormat, args.textOptions, args.textSort);
    if (!add(std::shared_ptr<TLOutputFormatter>(text))) {
        std::fputs("Unable to initialize text output\n", stderr);
        return false;
    }
    if (args.JSONOutputFile && !add(createJSONFormatter(*args.JSONOutputFile), *args.JSONOutputFile)) {
        std::fputs("Unable to create JSON output\n", stderr);
        return false;
    }
    if (args.benchlogOutputFile &&
        !add(createBenchlogFormatter(*args.benchlogOutputFile), *args.benchlogOutputFile)) {
        std::fputs("Unable to create benchlog output\n", stderr);
        return false;
    }
    return true;
}

bool OutputFiles::add(std::shared_ptr<TLOutputFormatter> formatter, std::string file) {
    if (!formatter) {
        return false;
    }
    formatters_.push_back(std::move(formatter));
    if (!file.empty()) {
        files_.push_back(std::move(file));
    }
    return true;
}

void OutputFiles::close() const {
    for (const auto& formatter : formatters_) {
        formatter->close();
    }
}

void OutputFiles::deleteFiles() const {
    for (const std::string& file : files_) {
        std::error_code ignored;
        std::filesystem::remove(file, ignored);
    }
}

} // namespace tally
