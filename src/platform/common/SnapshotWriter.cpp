// SnapshotWriter: a snapshot as a document, one region a line. What a key stands for when it is left out is
// not written.

#include "platform/common/SnapshotKeys.h"
#include "platform/common/SnapshotText.h"
#include "platform/quarry.h"

#include <nlohmann/json.hpp>

namespace tally::platform {

namespace {

using Json = nlohmann::ordered_json;

template <typename Record, typename Numbers, typename Flags>
void addKeys(Json& object, const Record& record, const Numbers& numbers, const Flags& flags) {
    static const Record missing;
    for (const auto& key : numbers) {
        if (key.isRequired || key.get(record) != key.get(missing)) {
            object[key.name] = key.get(record);
        }
    }
    for (const auto& key : flags) {
        if (key.isRequired || record.*(key.member) != missing.*(key.member)) {
            object[key.name] = record.*(key.member);
        }
    }
}

Json documentOf(const QRYSnapshot& snapshot) {
    Json document;
    document["format"] = snapshotFormat;
    document["version"] = snapshotVersion;
    document["process_name"] = snapshotTextOfName(snapshot.processName);
    document["architecture"] = snapshot.architecture;
    if (!snapshot.binaryImages.empty()) {
        document["binary_images"] = snapshotTextOfName(snapshot.binaryImages);
    }
    addKeys(document, snapshot, snapshotNumbers, snapshotFlags);
    return document;
}

/// Tags that the platform has given to names mean something in this run only: they travel as names.
std::optional<std::string> nameOfTag(std::uint32_t tag) {
    std::optional<std::string> name = QRYRegionTypeDescriptionForTag(tag);
    return name && !name->starts_with("Memory Tag") ? name : std::nullopt;
}

Json documentOf(const QRYVMRegion& region) {
    Json document;
    addKeys(document, region, snapshotRegionNumbers, snapshotRegionFlags);
    document["type"] = snapshotTextOfName(region.type.view());
    if (!region.path.isNull()) {
        document["path"] = snapshotTextOfName(region.path.view());
    }
    if (const std::optional<std::string> name = nameOfTag(region.user_tag)) {
        document.erase("user_tag");
        document["tag_name"] = snapshotTextOfName(*name);
    }
    return document;
}

} // namespace

std::string QRYDataWithSnapshot(const QRYSnapshot& snapshot) {
    std::string text = documentOf(snapshot).dump();
    text.back() = ','; // the regions come last
    text += "\"regions\":[";
    const char* separator = "\n";
    for (const QRYVMRegion& region : snapshot.regions) {
        text += separator;
        text += documentOf(region).dump();
        separator = ",\n";
    }
    return text + "\n]}\n";
}

} // namespace tally::platform
