// SnapshotWriter: a snapshot as a document, one region a line. What a key stands for when it is left out is
// not written.

#include "base/JSONWriter.h"
#include "platform/common/SnapshotKeys.h"
#include "platform/common/SnapshotText.h"
#include "platform/quarry.h"

#include <string_view>

namespace tally::platform {

namespace {

void addText(JSONWriter& json, const char* key, std::string_view text) {
    json.key(key);
    json.string(text);
}

void addName(JSONWriter& json, const char* key, std::string_view name) {
    addText(json, key, snapshotTextOfName(name));
}

template <typename Record, typename Numbers, typename Flags>
void addKeys(JSONWriter& json, const Record& record, const Numbers& numbers, const Flags& flags,
             std::string_view leftOut = {}) {
    static const Record missing;
    for (const auto& key : numbers) {
        if ((key.isRequired || key.get(record) != key.get(missing)) && key.name != leftOut) {
            json.key(key.name);
            json.number(key.get(record));
        }
    }
    for (const auto& key : flags) {
        if (key.isRequired || record.*(key.member) != missing.*(key.member)) {
            json.key(key.name);
            json.boolean(record.*(key.member));
        }
    }
}

/// Tags that the platform has given to names mean something in this run only: they travel as names.
std::optional<std::string> nameOfTag(std::uint32_t tag) {
    std::optional<std::string> name = QRYRegionTypeDescriptionForTag(tag);
    return name && !name->starts_with("Memory Tag") ? name : std::nullopt;
}

void addRegion(JSONWriter& json, const QRYVMRegion& region) {
    const std::optional<std::string> tagName = nameOfTag(region.user_tag);
    json.beginObject();
    addKeys(json, region, snapshotRegionNumbers, snapshotRegionFlags, tagName ? "user_tag" : "");
    addName(json, "type", region.type.view());
    if (!region.path.isNull()) {
        addName(json, "path", region.path.view());
    }
    if (tagName) {
        addName(json, "tag_name", *tagName);
    }
    json.endObject();
}

} // namespace

std::string QRYDataWithSnapshot(const QRYSnapshot& snapshot) {
    JSONWriter json;
    json.beginObject();
    addText(json, "format", snapshotFormat);
    json.key("version");
    json.number(snapshotVersion);
    addName(json, "process_name", snapshot.processName);
    addText(json, "architecture", snapshot.architecture);
    if (!snapshot.binaryImages.empty()) {
        addName(json, "binary_images", snapshot.binaryImages);
    }
    addKeys(json, snapshot, snapshotNumbers, snapshotFlags);
    json.key("regions"); // last
    json.beginArray();
    std::string text = json.takeText();
    for (const QRYVMRegion& region : snapshot.regions) {
        addRegion(json, region);
        const std::string written = json.takeText();
        text += written.starts_with(',') ? ",\n" + written.substr(1) : "\n" + written;
    }
    return text + "\n]}\n";
}

} // namespace tally::platform
