// The merge of auxiliary data: sums what may be summed and drops the rest. Inputs never change; one
// dictionary per level is built for each merge.

#include "process/TLAuxData.h"

#include "base/Assertion.h"

#include <utility>

namespace tally {

TLAuxDatum::TLAuxDatum(TLAuxData leaf) : value_(leaf) {}

TLAuxDatum::TLAuxDatum(TLAuxDictionary dictionary)
    : value_(std::make_shared<const TLAuxDictionary>(std::move(dictionary))) {}

std::optional<TLAuxDatum> mergeAuxDatum(const TLAuxDatum& datum1, const TLAuxDatum* datum2) {
    tl_assert(datum2 == nullptr || datum1.isContainer() == datum2->isContainer(),
              "!datum2 || datum1.isContainer == datum2.isContainer");
    if (datum1.isContainer()) {
        auto merged = datum1.dictionary().mergeWithData(
            datum2 == nullptr ? std::nullopt : std::optional(datum2->dictionary()));
        return merged ? std::optional<TLAuxDatum>(*std::move(merged)) : std::nullopt;
    }
    if (!datum1.leaf().shouldAggregate()) {
        return std::nullopt;
    }
    if (datum2 == nullptr) {
        return datum1;
    }
    return TLAuxDatum(TLAuxData(datum1.leaf().value() + datum2->leaf().value(), true));
}

bool TLAuxDatum::isContainer() const { return value_.index() == 1; }

const TLAuxData& TLAuxDatum::leaf() const { return std::get<TLAuxData>(value_); }

const TLAuxDictionary& TLAuxDatum::dictionary() const {
    return *std::get<std::shared_ptr<const TLAuxDictionary>>(value_);
}

bool operator==(const TLAuxDatum& a, const TLAuxDatum& b) {
    if (a.isContainer() != b.isContainer()) {
        return false;
    }
    return a.isContainer() ? a.dictionary() == b.dictionary() : a.leaf() == b.leaf();
}

std::optional<TLAuxDictionary>
TLAuxDictionary::mergeWithData(const std::optional<TLAuxDictionary>& other) const {
    TLAuxDictionary result;
    const auto add = [&](const std::string& key, const TLAuxDatum& datum, const TLAuxDatum* otherDatum) {
        if (auto merged = mergeAuxDatum(datum, otherDatum)) {
            result.entries.emplace(key, *std::move(merged));
        }
    };
    static const TLAuxDictionary nothing;
    const auto& others = (other ? *other : nothing).entries;
    for (const auto& [key, datum] : entries) {
        const auto found = others.find(key);
        add(key, datum, found == others.end() ? nullptr : &found->second);
    }
    for (const auto& [key, datum] : others) {
        if (!entries.contains(key)) {
            add(key, datum, nullptr);
        }
    }
    return result.entries.empty() ? std::nullopt : std::optional(std::move(result));
}

} // namespace tally
