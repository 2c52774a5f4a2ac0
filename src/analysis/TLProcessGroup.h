// TLProcessGroup: an exact set of processes, and the memory objects that exactly these processes map.

#pragma once

#include "analysis/TLMemoryCategory.h"
#include "process/TLProcess.h"
#include "vm/TLMemoryObject.h"

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace tally {

/// A set of processes that is still being filled. The hash depends on the order of adding: all groups are
/// filled in the order of one process list.
class TLProcessGroupMinimal {
  public:
    TLProcessGroupMinimal() = default;
    TLProcessGroupMinimal(TLProcessGroupMinimal&&) = default;
    TLProcessGroupMinimal& operator=(TLProcessGroupMinimal&&) = default;
    virtual ~TLProcessGroupMinimal() = default;

    /// Adds a process; nothing happens when it is a member already. Cheap when pids rise.
    virtual void addProcess(const std::shared_ptr<TLProcess>& process);

    /// The members, ascending by pid.
    const std::vector<std::shared_ptr<TLProcess>>& processes() const { return processes_; }
    std::uint64_t hash() const { return hashValue_; }
    virtual bool isEqual(const TLProcessGroupMinimal& other) const;
    std::string description() const;

  protected:
    bool hasSameMembers(const TLProcessGroupMinimal& other) const;

  private:
    std::vector<std::shared_ptr<TLProcess>> processes_;
    std::uint64_t hashValue_ = 19;
};

/// A set of processes that no longer changes. Equal only to itself, and to a minimal group of the same
/// members.
class TLProcessGroup final : public TLProcessGroupMinimal {
  public:
    static std::shared_ptr<TLProcessGroup> makeImmutableGroup(TLProcessGroupMinimal minimal);
    explicit TLProcessGroup(TLProcessGroupMinimal minimal) : TLProcessGroupMinimal(std::move(minimal)) {}

    /// A programming error: stops the program.
    void addProcess(const std::shared_ptr<TLProcess>& process) override;
    bool isEqual(const TLProcessGroupMinimal& other) const override;

    void addObject(std::shared_ptr<TLMemoryObject> object) { objects_.push_back(std::move(object)); }
    const std::vector<std::shared_ptr<TLMemoryObject>>& objects() const { return objects_; }

    /// Keeps `categories` for the next `refcount` (not 0) processes.
    void cacheCategories(std::shared_ptr<const TLCategoryDictionary> categories, std::uint32_t refcount);
    /// The kept categories, once less from now on; null when there are none.
    std::shared_ptr<const TLCategoryDictionary> takeCachedCategories();
    std::uint32_t categoriesRefcount() const { return categoriesRefcount_; }

  private:
    std::uint32_t categoriesRefcount_ = 0;
    std::vector<std::shared_ptr<TLMemoryObject>> objects_;
    std::shared_ptr<const TLCategoryDictionary> categories_;
};

} // namespace tally
