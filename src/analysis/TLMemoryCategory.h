// TLMemoryCategory: the memory objects that bear one name, summed; the row of a report.

#pragma once

#include "base/Name.h"
#include "vm/TLMemoryObject.h"

#include <cstdint>
#include <map>
#include <memory>
#include <string>

namespace tally {

/// The sums of a row, or of several.
struct TLMemoryTotals : TLRangeSizes {
    std::uint32_t regions = 0;

    TLMemoryTotals& operator+=(const TLMemoryTotals& other) {
        TLRangeSizes::operator+=(other);
        regions += other.regions;
        return *this;
    }
    friend bool operator==(const TLMemoryTotals&, const TLMemoryTotals&) = default;
};

class TLMemoryCategory {
  public:
    TLMemoryCategory() = default;
    explicit TLMemoryCategory(bool isSummary) : isSummary_(isSummary) {}

    /// Folds in one object, which may be null. The first one gives the category its names.
    void addMemoryObject(std::shared_ptr<const TLMemoryObject> object);
    /// Folds in what a process sees of `object`, under whose key the category is filed. A view that bears
    /// another name, since others call the memory otherwise, names no category.
    void addViewOfObject(std::shared_ptr<const TLMemoryObject> view,
                         const std::shared_ptr<const TLMemoryObject>& object);

    bool isSummary() const { return isSummary_; }
    /// Lives no longer than the measurement it comes from.
    const std::shared_ptr<const TLMemoryObject>& firstMemoryObject() const { return firstMemoryObject_; }
    Name name() const;
    Name detailedName() const; // absent for a summary category
    std::string fullName() const;

    TLMemoryTotals totals;

  private:
    bool isSummary_ = false;
    std::shared_ptr<const TLMemoryObject> firstMemoryObject_;
};

/// Category key to category. In ascending order of keys, which sorts rows that are otherwise equal.
using TLCategoryDictionary = std::map<std::string, TLMemoryCategory, std::less<>>;

/// The key under which `object` is filed: its name, or without `summarize` its full name.
std::string categoryKey(const TLMemoryObject& object, bool summarize);

TLMemoryTotals totalsForCategories(const TLCategoryDictionary& categories);

} // namespace tally
