// Performance data as JSON Lines.
//
// Invariant: what goes to the file in one piece are whole lines, so a run that ends early leaves lines that
// can be read. A value's line is complete once nothing more can be attached to it.

#include "platform/benchlog.h"

#include "base/Format.h"
#include "base/JSONWriter.h"
#include "platform/clock.h"
#include "platform/output_file.h"

#include <array>
#include <charconv>
#include <cinttypes>
#include <cstdint>
#include <map>
#include <optional>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

constexpr int formatVersion = 1;
constexpr std::size_t mostBytesKept = 65536;

using Texts = std::map<std::string, std::string>;

struct Value {
    std::string metric;
    const char* unit = "";
    double number = 0;
    Texts variables{};
    Texts labels{};
    std::vector<std::string> tags{};
};

void addText(JSONWriter& json, std::string_view name, std::string_view text) {
    json.key(name);
    json.string(text);
}

/// Leaves out what is empty, as all lists of a line are.
void addTexts(JSONWriter& json, std::string_view name, const Texts& texts) {
    if (texts.empty()) {
        return;
    }
    json.key(name);
    json.beginObject();
    for (const auto& [key, text] : texts) {
        addText(json, key, text);
    }
    json.endObject();
}

void addTags(JSONWriter& json, const std::vector<std::string>& tags) {
    if (tags.empty()) {
        return;
    }
    json.key("tags");
    json.beginArray();
    for (const std::string& tag : tags) {
        json.string(tag);
    }
    json.endArray();
}

/// The shortest decimal number, without an exponent, that reads as `number`.
std::string decimal(double number) {
    std::array<char, 400> digits; // more than any double has
    const auto end = std::to_chars(digits.begin(), digits.end(), number, std::chars_format::fixed).ptr;
    return {digits.begin(), end};
}

/// Now, in seconds since 1970; empty when the clock cannot be read.
std::string secondsNow() {
    mach_times now;
    return mach_get_times(&now) == 0 ? formatted("%" PRId64 ".%03d", now.wall_seconds,
                                                 static_cast<int>(now.wall_nanoseconds / 1'000'000))
                                     : std::string();
}

} // namespace

struct BenchlogWriter {
    std::unique_ptr<OutputFile> file;
    std::optional<JSONWriter> header; // until it is written
    std::uint64_t group = 0;
    std::optional<Value> value; // the one that can still get something attached
    std::string lines;          // complete, not written yet

    void finishHeader() {
        if (header) {
            finishLine(*std::exchange(header, std::nullopt));
        }
    }

    JSONWriter lineOfGroup() const {
        JSONWriter json;
        json.beginObject();
        json.key("group");
        json.number(group);
        return json;
    }

    void finishLine(JSONWriter json) {
        json.endObject();
        lines += json.text() + "\n";
    }

    void finishValue() {
        if (!value) {
            return;
        }
        JSONWriter json = lineOfGroup();
        addText(json, "metric", value->metric);
        addText(json, "unit", value->unit);
        json.key("value");
        json.element(decimal(value->number));
        addTexts(json, "variables", value->variables);
        addTexts(json, "labels", value->labels);
        addTags(json, value->tags);
        finishLine(std::move(json));
        value.reset();
        if (lines.size() >= mostBytesKept) {
            writeLines();
        }
    }

    void writeLines() {
        file->write(lines);
        lines.clear();
    }
};

void BenchlogWriterDeleter::operator()(BenchlogWriter* writer) const { delete writer; }

BenchlogHandle blwriter_open(const std::string& path, std::string_view benchmark, int version,
                             int /*flags*/) {
    std::unique_ptr<OutputFile> file = OutputFile::open(path);
    if (!file) {
        return nullptr;
    }
    BenchlogHandle writer(new BenchlogWriter);
    writer->file = std::move(file);
    JSONWriter& header = writer->header.emplace();
    header.beginObject();
    header.key("benchlog");
    header.signedNumber(formatVersion);
    addText(header, "benchmark", benchmark);
    header.key("version");
    header.signedNumber(version);
    return writer;
}

void blwriter_set_description(BenchlogWriter& writer, std::string_view description) {
    addText(*writer.header, "description", description);
}

void blwriter_set_primary_metric(BenchlogWriter& writer, std::string_view metric) {
    addText(*writer.header, "primary_metric", metric);
}

void blwriter_new_group(BenchlogWriter& writer) {
    writer.finishHeader();
    writer.finishValue();
    writer.writeLines();
    ++writer.group;
    JSONWriter json = writer.lineOfGroup();
    if (const std::string time = secondsNow(); !time.empty()) {
        json.key("time");
        json.element(time);
    }
    writer.finishLine(std::move(json));
}

void blwriter_new_value(BenchlogWriter& writer, std::string_view metric, BenchlogUnit unit, double value) {
    writer.finishHeader();
    writer.finishValue();
    writer.value = Value{.metric = std::string(metric), .unit = unit.name, .number = value};
}

void blwriter_record_variable_str(BenchlogWriter& writer, std::string_view name, std::string_view value) {
    writer.value.value().variables.insert_or_assign(std::string(name), std::string(value));
}

void blwriter_record_label_str(BenchlogWriter& writer, std::string_view name, std::string_view value) {
    writer.value.value().labels.insert_or_assign(std::string(name), std::string(value));
}

void blwriter_record_tag(BenchlogWriter& writer, BenchlogTag tag) {
    writer.value.value().tags.emplace_back(tag.name);
}

int blwriter_close(BenchlogHandle writer) {
    writer->finishHeader();
    writer->finishValue();
    writer->writeLines();
    return writer->file->close();
}

void blwriter_spare_earlier(BenchlogWriter& writer) { writer.file->spareEarlier(); }

void blwriter_discard(BenchlogHandle writer) { writer->file->discard(); }

} // namespace tally::platform
