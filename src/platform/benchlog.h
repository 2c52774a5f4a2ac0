// The performance-data writer.
//
// A file is a sequence of groups of values; what is recorded after a value is attached to it. The form is
// docs/benchlog-format.md. A writer is used by one thread at a time.

#pragma once

#include <memory>
#include <string>
#include <string_view>

namespace tally::platform {

struct BenchlogUnit {
    const char* name;
};
inline constexpr BenchlogUnit blunit_B{"B"};   // bytes
inline constexpr BenchlogUnit blunit_ms{"ms"}; // milliseconds

struct BenchlogTag {
    const char* name;
};
inline constexpr BenchlogTag bltag_summary{"summary"}; // a figure that sums others up
inline constexpr BenchlogTag bltag_context{"context"}; // a figure that explains others

/// One performance-data file that is being written.
struct BenchlogWriter;
struct BenchlogWriterDeleter {
    void operator()(BenchlogWriter* writer) const;
};
using BenchlogHandle = std::unique_ptr<BenchlogWriter, BenchlogWriterDeleter>;

/// Creates the file of `path`, or empties the one that is there.
/// @param version of what the benchmark measures: figures of two versions do not compare.
/// @param flags   0: none is defined.
/// @return the writer; null, with errno set, when that cannot be done.
BenchlogHandle blwriter_open(const std::string& path, std::string_view benchmark, int version, int flags);

/// Says what the benchmark is. Before the first group.
void blwriter_set_description(BenchlogWriter& writer, std::string_view description);
/// Names what tools show first, as "metric,variable=value". Before the first group.
void blwriter_set_primary_metric(BenchlogWriter& writer, std::string_view metric);

/// Begins a group, which the values to come belong to.
void blwriter_new_group(BenchlogWriter& writer);
void blwriter_new_value(BenchlogWriter& writer, std::string_view metric, BenchlogUnit unit, double value);

// What is attached to the value just added.
void blwriter_record_variable_str(BenchlogWriter& writer, std::string_view name, std::string_view value);
void blwriter_record_label_str(BenchlogWriter& writer, std::string_view name, std::string_view value);
void blwriter_record_tag(BenchlogWriter& writer, BenchlogTag tag);

/// Finishes the file. @return 0, or the errno of the first lines that could not be written.
int blwriter_close(BenchlogHandle writer);
/// Leaves an earlier file alone, as OutputFile::spareEarlier does.
void blwriter_spare_earlier(BenchlogWriter& writer);
/// Gives the file up, as OutputFile::discard does.
void blwriter_discard(BenchlogHandle writer);

} // namespace tally::platform
