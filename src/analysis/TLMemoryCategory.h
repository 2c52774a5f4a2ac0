// TLMemoryCategory: the memory objects that bear one name, summed; the row of a report.

#pragma once

#include "base/Name.h"
#include "vm/TLMemoryObject.h"

#include <cstdint>
#include <map>
#include <memory>
#include <string>

namespace tally {

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

    std::int32_t totalRegions = 0;
    // Bytes.
    std::uint64_t totalDirtySize = 0;
    std::uint64_t totalSwappedSize = 0;
    std::uint64_t totalCleanSize = 0;
    std::uint64_t totalReclaimableSize = 0;
    std::uint64_t totalWiredSize = 0;

  private:
    bool isSummary_ = false;
    std::shared_ptr<const TLMemoryObject> firstMemoryObject_;
};

/// Category key to category. In ascending order of keys, which sorts rows that are otherwise equal.
using TLCategoryDictionary = std::map<std::string, TLMemoryCategory, std::less<>>;

/// Sums over a category dictionary; bytes.
struct TLMemoryTotals {
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::uint64_t clean = 0;
    std::uint64_t reclaimable = 0;
    std::uint64_t wired = 0;
    std::uint32_t regions = 0;

    friend bool operator==(const TLMemoryTotals&, const TLMemoryTotals&) = default;
};

/// The key under which `object` is filed: its name, or without `summarize` its full name.
std::string categoryKey(const TLMemoryObject& object, bool summarize);

TLMemoryTotals totalsForCategories(const TLCategoryDictionary& categories);

} // namespace tally
