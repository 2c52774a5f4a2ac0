// The formatters of one run, and what becomes of the files that they write.
//
// A file is made with its formatter, before the targets are known, and must not survive a run that fails. A
// file whose formatter was never made is not ours.

#pragma once

#include "cli/TLTallyArgs.h"
#include "output/protocol/TLOutputFormatter.h"

#include <memory>
#include <string>
#include <vector>

namespace tally {

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
    /// Tells every formatter that no report follows. @return whether all they were told is in their files; a
    /// message per file has gone to standard error otherwise.
    bool close() const;
    /// Deletes the files, as far as the formatters made them.
    void discard() const;

  private:
    bool createBenchlog(const TLTallyArgs& args);

    Formatters formatters_;
    std::vector<std::string> paths_; // of the formatters' files; empty: standard output
};

} // namespace tally
