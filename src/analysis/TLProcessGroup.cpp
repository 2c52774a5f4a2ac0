// TLProcessGroup: membership, identity, and the categories that the members of a large group share.

#include "analysis/TLProcessGroup.h"

#include "base/Assertion.h"

#include <algorithm>
#include <typeinfo>

namespace tally {

void TLProcessGroupMinimal::addProcess(const std::shared_ptr<TLProcess>& process) {
    const std::int32_t pid = process->pid();
    auto at = processes_.end();
    if (!processes_.empty() && processes_.back()->pid() >= pid) {
        at = std::ranges::lower_bound(processes_, pid, {}, [](const auto& member) { return member->pid(); });
        if ((*at)->pid() == pid) {
            return;
        }
    }
    processes_.insert(at, process);
    hashValue_ = hashValue_ * 37 ^ static_cast<std::uint64_t>(std::int64_t{pid});
}

bool TLProcessGroupMinimal::hasSameMembers(const TLProcessGroupMinimal& other) const {
    return std::ranges::equal(processes_, other.processes_,
                              [](const auto& a, const auto& b) { return *a == *b; });
}

bool TLProcessGroupMinimal::isEqual(const TLProcessGroupMinimal& other) const {
    return hasSameMembers(other);
}

std::string TLProcessGroupMinimal::description() const {
    std::string text = "TLProcessGroup{";
    for (const auto& process : processes_) {
        text += (process == processes_.front() ? "" : ", ") + process->description();
    }
    return text + "}";
}

std::shared_ptr<TLProcessGroup> TLProcessGroup::makeImmutableGroup(TLProcessGroupMinimal minimal) {
    return std::make_shared<TLProcessGroup>(std::move(minimal));
}

void TLProcessGroup::addProcess(const std::shared_ptr<TLProcess>& /*process*/) {
    failAssertion("Attempt to add process to immutable TLProcessGroup");
}

bool TLProcessGroup::isEqual(const TLProcessGroupMinimal& other) const {
    return typeid(other) == typeid(TLProcessGroupMinimal) ? hasSameMembers(other) : this == &other;
}

void TLProcessGroup::cacheCategories(std::shared_ptr<const TLCategoryDictionary> categories,
                                     std::uint32_t refcount) {
    tl_assert(refcount != 0, "refcount != 0");
    categories_ = std::move(categories);
    categoriesRefcount_ = refcount;
}

std::shared_ptr<const TLCategoryDictionary> TLProcessGroup::takeCachedCategories() {
    if (!categories_) {
        return nullptr;
    }
    --categoriesRefcount_;
    return categoriesRefcount_ == 0 ? std::exchange(categories_, nullptr) : categories_;
}

} // namespace tally
