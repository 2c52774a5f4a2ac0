#include "platform/mach_vm.h"
#include "platform/scripted/ScriptedKernel.h"
#include "vm/PhysTallyCollection.h"
#include "vm/TLMemoryObject.h"

#include <gtest/gtest.h>

#include <deque>
#include <tuple>

namespace tally {
namespace {

using namespace platform;

struct Holder final : MemoryHolder {
    explicit Holder(std::int32_t number, bool breaksDown = true) : number_(number), breaksDown_(breaksDown) {}
    std::int32_t pid() const override { return number_; }
    std::uint64_t pageSize() const override { return 0x1000; }
    bool breakDownPhysTally() const override { return breaksDown_; }

    std::int32_t number_;
    bool breaksDown_;
};

/// A region of the same 16 pages of one object; sizes in bytes.
struct Row {
    std::int32_t pid;
    std::uint64_t dirty;
    std::uint64_t swapped = 0;
    std::uint8_t shareMode = SM_SHARED;
    bool wired = false;
    std::uint64_t object = 5;
};
using Rows = std::vector<Row>;

class MemoryObject : public testing::Test {
  protected:
    MemoryObject() { setPhysTallyCollectionEnabled(1); }

    std::shared_ptr<TLMemoryObject> objectOf(const Rows& rows, std::int32_t owner = -1,
                                             bool breakDown = false) {
        const auto object = std::make_shared<TLMemoryObject>();
        for (const Row& row : rows) {
            TLMemoryRegion& region = regions_.emplace_back();
            region.object_id = row.object;
            region.size = 0x10000;
            region.dirtySize = row.dirty;
            region.swappedSize = row.swapped;
            region.reclaimableSize = 1;
            region.share_mode = row.shareMode;
            region.wired = row.wired;
            const Holder holder(row.pid);
            object->addRegionForProcess(region, &holder);
        }
        object->ownerPid = owner;
        object->finalizeSizes(breakDown);
        return object;
    }

    ScriptedKernel kernel_;
    std::deque<TLMemoryRegion> regions_;
};

TEST_F(MemoryObject, HasTheTotalsOfAUnionAndListsOnlyWhereTheyTellMore) {
    // The switch, the break-down; the totals dirty and swapped; the lists of processes that are kept.
    const std::tuple<Rows, bool, bool, std::uint64_t, std::uint64_t, std::size_t> cases[] = {
        {{{1, 8, 2}, {1, 4, 3}, {2, 3, 1}}, true, false, 12, 5, 2}, // no less than a process is charged
        {{{1, 8, 2}, {1, 4, 3}, {2, 3, 1}}, false, false, 8, 3, 2}, // the same pages once
        {{{1, 8, 2}, {1, 4, 3}, {2, 3, 1}}, true, true, 15, 6, 2},  // the sum of charges
        {{{1, 8}, {2, 8}}, true, false, 8, 0, 0},                   // both see the totals
        {{{1, 8}, {2, 4}}, true, false, 8, 0, 2},                   // one sees less
        {{{1, 8}, {1, 0}}, true, false, 8, 0, 0},                   // one process
        {{{1, 8}, {1, 0}, {2, 8}}, true, false, 8, 0, 2},           // one of two has two regions
        {{{1, 8, 0, SM_PRIVATE}, {2, 4, 0, SM_PRIVATE}}, true, false, 8, 0, 0},
        {{{1, 8, 0, SM_SHARED, true}, {2, 8}}, true, false, 8, 0, 2},                   // one has it wired
        {{{1, 8, 0, SM_SHARED, false, 0}, {2, 4}}, true, false, 4, 0, 0},               // no object, no sizes
        {{{2, 8, 0, SM_PRIVATE}, {3, 9}, {1, 8, 0, SM_PRIVATE}}, true, false, 9, 0, 2}, // once shared, all
    };
    for (const auto& [rows, charged, breakDown, dirty, swapped, lists] : cases) {
        setPhysTallyCollectionEnabled(charged ? 1 : 0);
        const auto object = objectOf(rows, -1, breakDown);
        EXPECT_EQ(object->totals.dirty, dirty);
        EXPECT_EQ(object->totals.swapped, swapped);
        EXPECT_EQ(object->processMemoryRegions().size(), lists);
    }
}

TEST_F(MemoryObject, LooksDifferentToEachProcess) {
    // The owner, who looks; bytes dirty, clean and reclaimable; regions.
    const std::tuple<std::int32_t, Holder, std::uint64_t, std::uint64_t, std::uint64_t, std::size_t> cases[] =
        {
            {-1, Holder(1), 16, 0, 1, 2},    {-1, Holder(1, false), 8, 0, 1, 2}, // a union without break-down
            {-1, Holder(2), 3, 0, 1, 1},     {-1, Holder(3), 16, 0, 1, 3},       // no list: the object itself
            {1, Holder(1), 16, 0, 1, 2},     {1, Holder(2), 0, 16 + 4, 0, 1}, // the owner pays for all of it
            {1, Holder(3), 0, 16 + 4, 0, 3},
        };
    for (const auto& [owner, viewer, dirty, clean, reclaimable, regions] : cases) {
        const auto object = objectOf({{1, 8, 4}, {1, 8}, {2, 3}}, owner);
        const auto view = object->viewForProcess(viewer);
        EXPECT_EQ(view->totals.dirty, dirty);
        EXPECT_EQ(view->totals.clean, clean);
        EXPECT_EQ(view->totals.reclaimable, reclaimable);
        EXPECT_EQ(view->memoryRegions().size(), regions);
    }
}

TEST_F(MemoryObject, BearsTheNameOfTheRegionThatTellsMost) {
    const auto object = objectOf({{1, 0}, {2, 0}});
    regions_[0].name = Name("first");
    regions_[1].name = Name("second");
    regions_[1].detailedName = Name("detail");
    EXPECT_EQ(object->fullName(), "first");
    regions_[0].inSharedCache = regions_[0].unusedSharedCacheRegion = true;
    EXPECT_EQ(object->fullName(), "second detail");
    // Unmapped memory of an owner takes the name under which another process maps it.
    regions_[0].inSharedCache = false;
    regions_[0].user_tag = TLUnmappedTag;
    TLMemoryObject owned;
    owned.addRegionWithPageSize(regions_[0], 0x1000, nullptr);
    owned.addRegionWithPageSize(regions_[1], 0x1000, nullptr);
    EXPECT_EQ(owned.fullName(), "first") << "nobody owns it";
    owned.ownerPid = 1;
    owned.finalizeSizes(false);
    EXPECT_EQ(regions_[0].fullName(), "second detail");
    EXPECT_DEATH(owned.finalizeSizes(false), "accurateSizes");
    EXPECT_DEATH(owned.addRegionWithPageSize(regions_[0], 0x1000, nullptr), "accurateSizes");
    regions_[0].start = 0x2000;
    EXPECT_DEATH(regions_[0].setEnd(0x1000), "end >= self.start.*TLMemoryRegion");
}

} // namespace
} // namespace tally
