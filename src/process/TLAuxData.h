// Auxiliary data: named figures of a process as a whole, as a tree.
//
// A leaf is one signed number and whether it may be summed across processes. Values, so a merge never changes
// its inputs.

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <variant>

namespace tally {

class TLAuxData {
  public:
    TLAuxData(std::int64_t value, bool shouldAggregate) : aggregate_(shouldAggregate), value_(value) {}

    std::int64_t value() const { return value_; } // bytes or a count, as its producer says
    bool shouldAggregate() const { return aggregate_; }

    friend bool operator==(const TLAuxData&, const TLAuxData&) = default;

  private:
    bool aggregate_;
    std::int64_t value_;
};

struct TLAuxDictionary;

/// A leaf or a nested dictionary.
class TLAuxDatum {
  public:
    TLAuxDatum(TLAuxData leaf);             // NOLINT(google-explicit-constructor): a leaf is a datum
    TLAuxDatum(TLAuxDictionary dictionary); // NOLINT(google-explicit-constructor): so is a dictionary
    bool isContainer() const;
    const TLAuxData& leaf() const;
    const TLAuxDictionary& dictionary() const;

    friend bool operator==(const TLAuxDatum& a, const TLAuxDatum& b);

  private:
    std::variant<TLAuxData, std::shared_ptr<const TLAuxDictionary>> value_;
};

/// Keys in ascending order.
struct TLAuxDictionary {
    std::map<std::string, TLAuxDatum, std::less<>> entries;

    bool isContainer() const { return true; }
    /// The sums of what may be summed, of this dictionary and `other` (which may be absent); absent when
    /// nothing is left. A leaf against a dictionary under one key stops the program.
    std::optional<TLAuxDictionary> mergeWithData(const std::optional<TLAuxDictionary>& other) const;

    friend bool operator==(const TLAuxDictionary&, const TLAuxDictionary&) = default;
};

/// The merge of one entry; `datum2` may be null. Absent when the entry is dropped.
std::optional<TLAuxDatum> mergeAuxDatum(const TLAuxDatum& datum1, const TLAuxDatum* datum2);

} // namespace tally
