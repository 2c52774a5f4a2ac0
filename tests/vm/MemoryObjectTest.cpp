#include "vm/TLMemoryObject.h"

#include <gtest/gtest.h>

namespace tally {
namespace {

// Its figures are the reference model's business; what would falsify them is refused.
TEST(MemoryObject, IsFinishedOnceAndTakesNothingThen) {
    TLMemoryRegion region;
    TLMemoryObject object;
    object.addRegionWithPageSize(region, 0x1000, nullptr);
    object.finalizeSizes(false);
    EXPECT_DEATH(object.finalizeSizes(false), "accurateSizes");
    EXPECT_DEATH(object.addRegionWithPageSize(region, 0x1000, nullptr), "accurateSizes");
    region.start = 0x2000;
    EXPECT_DEATH(region.setEnd(0x1000), "end >= self.start.*TLMemoryRegion");
}

} // namespace
} // namespace tally
