// TLMemoryCategory: folding objects into rows, rows into totals.

#include "analysis/TLMemoryCategory.h"

#include <utility>

namespace tally {

void TLMemoryCategory::addMemoryObject(std::shared_ptr<const TLMemoryObject> object) {
    if (!object) {
        return;
    }
    totals += TLMemoryTotals{object->totals, static_cast<std::uint32_t>(object->memoryRegions().size())};
    if (!firstMemoryObject_) {
        firstMemoryObject_ = std::move(object);
    }
}

void TLMemoryCategory::addViewOfObject(std::shared_ptr<const TLMemoryObject> view,
                                       const std::shared_ptr<const TLMemoryObject>& object) {
    if (!firstMemoryObject_ && categoryKey(*view, isSummary_) != categoryKey(*object, isSummary_)) {
        firstMemoryObject_ = object;
    }
    addMemoryObject(std::move(view));
}

Name TLMemoryCategory::name() const { return firstMemoryObject_ ? firstMemoryObject_->name() : Name(); }

Name TLMemoryCategory::detailedName() const {
    return isSummary_ || !firstMemoryObject_ ? Name() : firstMemoryObject_->detailedName();
}

std::string TLMemoryCategory::fullName() const {
    return firstMemoryObject_ ? categoryKey(*firstMemoryObject_, isSummary_) : std::string();
}

std::string categoryKey(const TLMemoryObject& object, bool summarize) {
    return summarize ? std::string(object.name().view()) : object.fullName();
}

TLMemoryTotals totalsForCategories(const TLCategoryDictionary& categories) {
    TLMemoryTotals totals;
    for (const auto& [key, category] : categories) {
        totals += category.totals;
    }
    return totals;
}

} // namespace tally
