// SnapshotReader: from the bytes of a snapshot file, which anybody can have written, to a snapshot.
//
// The document is read as it comes, so memory is that of the regions it holds and nesting is bounded by the
// three levels that it may have. Every value is checked before it is believed; the first that is wrong ends
// the reading with a text that says where.

#include "platform/common/SnapshotKeys.h"
#include "platform/common/SnapshotText.h"
#include "platform/quarry.h"

#include <nlohmann/json.hpp>

#include <algorithm>
#include <bit>
#include <new>
#include <optional>
#include <set>
#include <span>

namespace tally::platform {

namespace {

using Json = nlohmann::json;

constexpr std::size_t mostRegions = 1'000'000;

std::string inQuotes(std::string_view key) { return '"' + std::string(key) + '"'; }

/// The entry of `keys` called `name`; null when there is none.
template <typename Keys>
auto findKey(const Keys& keys, std::string_view name) {
    const auto found = std::ranges::find_if(keys, [&](const auto& key) { return name == key.name; });
    return found == std::end(keys) ? nullptr : &*found;
}

/// The architecture to describe `snapshot` by. The range of its shared library cache is made up, so it must
/// not cover what the process really has: on Linux, stacks lie where X86-64 would have its cache.
std::string architectureFor(const QRYSnapshot& snapshot) {
    const auto isFree = [&](std::string_view word) {
        const auto architecture = QRYArchitectureOf(word, snapshot.binaryImages);
        return std::ranges::none_of(snapshot.regions, [&](const QRYVMRegion& region) {
            return region.address < architecture->cacheBase + architecture->cacheSize &&
                   region.address + region.length > architecture->cacheBase;
        });
    };
    if (snapshot.architecture.empty() || isFree(snapshot.architecture)) {
        return snapshot.architecture;
    }
    const auto* const free =
        std::ranges::find_if(QRYArchitectures, [&](const auto& each) { return isFree(each.word); });
    return free == std::end(QRYArchitectures) ? "" : std::string(free->word);
}

/// Takes the document in, event after event. An event that returns false ends the reading.
class SnapshotHandler final : public nlohmann::json_sax<Json> {
  public:
    QRYSnapshot take() {
        for (const auto& [index, name] : tagNames_) {
            snapshot_.regions[index].user_tag = QRYTagForRegionTypeDescription(name.view());
        }
        snapshot_.architecture = architectureFor(snapshot_);
        return std::move(snapshot_);
    }
    const std::string& error() const { return error_; }

    bool null() override { return fail("no value"); }
    bool number_float(double /*value*/, const std::string& /*text*/) override {
        return fail("a number that is not whole or too large");
    }
    bool binary(Json::binary_t& /*value*/) override { return fail("binary data"); }
    bool number_integer(std::int64_t value) override {
        return value < 0 ? fail("a negative number") : number_unsigned(static_cast<std::uint64_t>(value));
    }
    bool number_unsigned(std::uint64_t value) override;
    bool boolean(bool value) override;
    bool string(std::string& value) override;
    bool start_object(std::size_t /*size*/) override;
    bool key(std::string& name) override;
    bool end_object() override;
    bool start_array(std::size_t /*size*/) override;
    bool end_array() override;
    bool parse_error(std::size_t position, const std::string& /*token*/,
                     const nlohmann::detail::exception& /*reason*/) override;

  private:
    enum class Place { outside, document, regions, region };

    bool inRegion() const { return place_ == Place::region; }
    bool refuse(const std::string& reason);
    /// Refuses the value of the current key, which is `what`.
    bool fail(std::string_view what);
    bool require(std::string_view name);
    template <typename Record>
    bool setNumber(Record& record, std::span<const NumberKey<Record>> keys, std::uint64_t value);
    template <typename Record>
    bool setFlag(Record& record, std::span<const FlagKey<Record>> keys, bool value);
    template <typename Keys>
    bool requireKeys(const Keys& keys);
    bool finishRegion();
    bool finishDocument();

    QRYSnapshot snapshot_;
    QRYVMRegion region_;                                 // that is being read
    std::vector<std::pair<std::size_t, Name>> tagNames_; // by index of the region
    std::uint64_t end_ = 0;                              // of the regions so far
    Place place_ = Place::outside;
    bool isOurs_ = false; // the document says so itself
    std::string key_;
    std::set<std::string, std::less<>> documentKeys_; // met so far
    std::set<std::string, std::less<>> regionKeys_;
    std::string error_;
};

bool SnapshotHandler::refuse(const std::string& reason) {
    if (error_.empty()) {
        error_ = isOurs_ ? "" : "not a heapsnap file: ";
        error_ += inRegion() ? "region " + std::to_string(snapshot_.regions.size()) + ": " : "";
        error_ += reason;
    }
    return false;
}

bool SnapshotHandler::fail(std::string_view what) {
    return refuse((place_ == Place::document || inRegion() ? inQuotes(key_) : "the document") + " is " +
                  std::string(what));
}

template <typename Record>
bool SnapshotHandler::setNumber(Record& record, std::span<const NumberKey<Record>> keys,
                                std::uint64_t value) {
    const NumberKey<Record>* const key = findKey(keys, key_);
    if (key == nullptr) {
        return fail("a number");
    }
    if (value > key->most) {
        return fail("larger than " + std::to_string(key->most));
    }
    key->set(record, value);
    return true;
}

bool SnapshotHandler::number_unsigned(std::uint64_t value) {
    if (place_ == Place::document && key_ == "version") {
        return value == snapshotVersion ||
               refuse("version " + std::to_string(value) + " of the format is not known");
    }
    return inRegion()                  ? setNumber<QRYVMRegion>(region_, snapshotRegionNumbers, value)
           : place_ == Place::document ? setNumber<QRYSnapshot>(snapshot_, snapshotNumbers, value)
                                       : fail("a number");
}

template <typename Record>
bool SnapshotHandler::setFlag(Record& record, std::span<const FlagKey<Record>> keys, bool value) {
    const FlagKey<Record>* const key = findKey(keys, key_);
    if (key != nullptr) {
        record.*(key->member) = value;
    }
    return key != nullptr || fail("true or false");
}

bool SnapshotHandler::boolean(bool value) {
    return inRegion()                  ? setFlag<QRYVMRegion>(region_, snapshotRegionFlags, value)
           : place_ == Place::document ? setFlag<QRYSnapshot>(snapshot_, snapshotFlags, value)
                                       : fail("true or false");
}

bool SnapshotHandler::string(std::string& value) {
    const auto isKey = [&](Place place, std::string_view name) { return place_ == place && key_ == name; };
    if (isKey(Place::document, "format")) {
        isOurs_ = value == snapshotFormat;
        return isOurs_ || refuse("its format is " + inQuotes(value.substr(0, 40)));
    }
    const std::string name = nameOfSnapshotText(value);
    if (isKey(Place::document, "process_name")) {
        snapshot_.processName = name;
    } else if (isKey(Place::document, "binary_images")) {
        snapshot_.binaryImages = name;
    } else if (isKey(Place::document, "architecture")) {
        const bool isKnown = name.empty() || std::ranges::any_of(QRYArchitectures, [&](const auto& known) {
                                 return known.word == name;
                             });
        snapshot_.architecture = name;
        return isKnown || fail("no architecture that is known");
    } else if (isKey(Place::region, "type")) {
        region_.type = Name(name);
    } else if (isKey(Place::region, "path")) {
        region_.path = Name(name);
    } else if (isKey(Place::region, "tag_name")) {
        tagNames_.emplace_back(snapshot_.regions.size(), Name(name));
    } else {
        return fail("a text");
    }
    return true;
}

bool SnapshotHandler::start_object(std::size_t /*size*/) {
    if (place_ == Place::outside) {
        place_ = Place::document;
        return true;
    }
    if (place_ != Place::regions) {
        return fail("an object");
    }
    if (snapshot_.regions.size() == mostRegions) {
        return refuse("more than " + std::to_string(mostRegions) + " regions");
    }
    place_ = Place::region;
    region_ = QRYVMRegion();
    regionKeys_.clear();
    return true;
}

bool SnapshotHandler::key(std::string& name) {
    constexpr std::string_view documentKeys[] = {"format",       "version",       "process_name",
                                                 "architecture", "binary_images", "regions"};
    constexpr std::string_view regionKeys[] = {"type", "path", "tag_name"};
    const auto isOneOf = [&](const auto& names) { return std::ranges::find(names, name) != std::end(names); };
    const bool isKnown =
        inRegion() ? isOneOf(regionKeys) || findKey(snapshotRegionNumbers, name) ||
                         findKey(snapshotRegionFlags, name)
                   : isOneOf(documentKeys) || findKey(snapshotNumbers, name) || findKey(snapshotFlags, name);
    if (!isKnown) {
        return refuse("unknown key " + inQuotes(name.substr(0, 40)));
    }
    if (!(inRegion() ? regionKeys_ : documentKeys_).insert(name).second) {
        return refuse(inQuotes(name) + " is there twice");
    }
    key_ = std::move(name);
    // What the rest means depends on these two.
    return inRegion() || (require("format") && (key_ == "format" || require("version")));
}

bool SnapshotHandler::require(std::string_view name) {
    return (inRegion() ? regionKeys_ : documentKeys_).contains(name) ||
           refuse(inQuotes(name) + " is missing");
}

template <typename Keys>
bool SnapshotHandler::requireKeys(const Keys& keys) {
    return std::ranges::all_of(keys, [&](const auto& key) { return !key.isRequired || require(key.name); });
}

bool SnapshotHandler::end_object() {
    if (place_ == Place::document) {
        return finishDocument();
    }
    const bool isWhole = finishRegion();
    place_ = isWhole ? Place::regions : place_;
    return isWhole;
}

bool SnapshotHandler::finishRegion() {
    if (!requireKeys(snapshotRegionNumbers) || !require("type")) {
        return false;
    }
    const QRYVMRegion& r = region_;
    if (r.length == 0 || r.address < end_) {
        return refuse(r.length == 0 ? "it is empty" : "it begins below the end of the one before it");
    }
    if (r.resident_size > r.length || r.swapped_out_size > r.length - r.resident_size ||
        r.dirty_size > r.resident_size || r.reusable_size > r.resident_size - r.dirty_size ||
        r.shared_now_private_size > r.resident_size) {
        return refuse("its sizes are larger than what they are a part of");
    }
    if (regionKeys_.contains("user_tag") && regionKeys_.contains("tag_name")) {
        return refuse("it has two tags");
    }
    end_ = r.address + r.length;
    if (r.object_id == 0 && (r.dirty_size | r.swapped_out_size | r.reusable_size) != 0) {
        region_.object_id = ~std::uint64_t{0}; // what is charged for is some object's, if nobody else's
    }
    snapshot_.regions.push_back(r);
    return true;
}

bool SnapshotHandler::finishDocument() {
    for (const char* name : {"format", "version", "process_name", "architecture", "regions"}) {
        if (!require(name)) {
            return false;
        }
    }
    if (!requireKeys(snapshotNumbers) || !requireKeys(snapshotFlags)) {
        return false;
    }
    constexpr std::uint32_t smallestPage = 512;
    if (!std::has_single_bit(snapshot_.vmPageSize) || snapshot_.vmPageSize < smallestPage) {
        return refuse("\"page_size\" is none");
    }
    const std::uint64_t most = snapshotMostPages * snapshot_.vmPageSize;
    return std::ranges::none_of(snapshot_.regions,
                                [&](const QRYVMRegion& region) {
                                    return region.resident_size > most || region.swapped_out_size > most;
                                }) ||
           refuse("a region has more pages than can be counted");
}

bool SnapshotHandler::start_array(std::size_t /*size*/) {
    if (place_ != Place::document || key_ != "regions") {
        return fail("a list");
    }
    place_ = Place::regions;
    return true;
}

bool SnapshotHandler::end_array() {
    place_ = Place::document;
    return true;
}

bool SnapshotHandler::parse_error(std::size_t position, const std::string& /*token*/,
                                  const nlohmann::detail::exception& /*reason*/) {
    return refuse("no JSON from byte " + std::to_string(position) + " on");
}

} // namespace

std::unique_ptr<QRYProcessObjectGraph> QRYDirectedGraphWithData(std::string_view contents,
                                                                std::string* error) {
    error->clear();
    if (contents.size() > QRYLargestSnapshotFile) {
        *error = "larger than any heapsnap file";
        return nullptr;
    }
    try {
        SnapshotHandler handler;
        if (Json::sax_parse(contents.begin(), contents.end(), &handler)) {
            return std::make_unique<QRYProcessObjectGraph>(handler.take());
        }
        *error = handler.error();
    } catch (const std::bad_alloc&) { // there is no memory for a text either
        error->clear();
    }
    return nullptr;
}

} // namespace tally::platform
