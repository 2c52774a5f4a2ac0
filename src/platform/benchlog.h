// The performance-data writer.

#pragma once

#include <memory>

namespace tally::platform {

/// One performance-data file that is being written.
class BenchlogWriter {
  public:
    virtual ~BenchlogWriter() = default;
};

/// Opens `path` for writing. @return the writer; null, with errno set, when that cannot be done.
std::unique_ptr<BenchlogWriter> blwriter_open(const char* path);

} // namespace tally::platform
