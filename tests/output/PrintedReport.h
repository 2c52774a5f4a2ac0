// What the text formatter prints, as a string.

#pragma once

#include "analysis/ReadyProcess.h"
#include "output/TLOutputFormatterText.h"

namespace tally {

/// Everything that `print` writes to the stream it is given.
inline std::string printed(const auto& print) {
    const std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::tmpfile(), std::fclose);
    print(file.get());
    std::string text(static_cast<std::size_t>(std::ftell(file.get())), '\0');
    std::rewind(file.get());
    EXPECT_EQ(std::fread(text.data(), 1, text.size(), file.get()), text.size());
    return text;
}

/// The text report of `processes`.
inline std::string reportText(const TLTally::ProcessList& processes, TLSummaryFormat format,
                              std::int64_t options, const char* sort, int formatters = 1) {
    return printed([&](std::FILE* file) {
        TLTally tally(processes);
        for (int i = 0; i < formatters; ++i) {
            tally.addOutputFormatter(std::make_shared<TLOutputFormatterText>(format, options, sort, file));
        }
        tally.analyzeMemoryObjects();
        tally.printReport(false, false);
    });
}

} // namespace tally
