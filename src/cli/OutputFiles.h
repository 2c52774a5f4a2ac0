// The formatters of one run, and what becomes of the files that they write.
//
// A file is opened with its formatter, before the targets are known, and emptied only when there is a report
// to write. It must not be what the run reads or measures. One that this run has made does not survive a run
// that fails.

#pragma once

#include "cli/TLTallyArgs.h"
#include "platform/output_file.h"
#include "process/TLProcess.h"
#include "report/TLOutputFormatter.h"

#include <memory>
#include <span>
#include <string>
#include <vector>

namespace tally {

/// The first of `processes`, gathered ones, that runs and maps the file of `path`; null when none does, or
/// there is no such file.
std::shared_ptr<TLProcess> processThatMaps(const std::string& path,
                                           std::span<const std::shared_ptr<TLProcess>> processes);

class OutputFiles {
  public:
    using Formatters = std::vector<std::shared_ptr<TLOutputFormatter>>;

    /// Makes the formatters that `args` ask for: text, JSON, performance data.
    /// @return whether all could be made; a message has gone to standard error otherwise.
    bool create(const TLTallyArgs& args);

    /// Appends a formatter; `file` is the path that it writes to, empty for standard output. Null is left
    /// out. @return whether there was one.
    bool add(std::shared_ptr<TLOutputFormatter> formatter, std::string file = {});

    /// The formatters in the order of adding.
    const Formatters& formatters() const { return formatters_; }
    /// Whether some formatter writes to a file.
    bool hasFiles() const;
    /// Leaves out, with a message, every file that one of `processes`, gathered ones, maps: emptying it would
    /// change what is measured, or end it. Before the first report.
    void leaveOutMapped(std::span<const std::shared_ptr<TLProcess>> processes);
    /// Lets the text go once nobody reads it, so that the files are completed. From any thread.
    void stopWaitingForReader() const;
    /// Tells every formatter that no report follows. @return whether all they were told, and all of the text,
    /// is where it belongs; a message per output has gone to standard error otherwise.
    bool close() const;
    /// Leaves files alone that held something before and were not written to yet.
    void spareEarlier() const;
    /// Deletes the files that this run has made.
    void discard() const;

  private:
    bool createBenchlog(const TLTallyArgs& args);

    std::unique_ptr<platform::StandardOutput> text_; // null without a text formatter of ours
    Formatters formatters_;
    std::vector<std::string> paths_; // of the formatters' files; empty: standard output
    bool isLeftOut_ = false;         // some file that was asked for
};

} // namespace tally
