// What of snapshots no file can show: memory in the place of a shared cache, which their readers keep free.

#include "platform/scripted/ScriptedKernel.h"
#include "process/TLHeapsnapProcess.h"
#include "process/WalkTest.h"

#include <set>

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t cacheBase = 0x7FF800000000;

std::shared_ptr<TLHeapsnapProcess> processOf(QRYSnapshot snapshot) {
    return TLHeapsnapProcess::initWithGraph(std::make_unique<QRYProcessObjectGraph>(std::move(snapshot)));
}

TEST(Heapsnap, MakesASharedCacheOfItsArchitecture) {
    const struct {
        std::string architecture, images;
        std::uint64_t base, size;
    } cases[] = {
        {"X86-64", "", cacheBase, 0x7FE000000},
        {"X86", "", 0x90000000, 0x20000000},
        {"ARM64_32", "", 0x1A000000, 0x40000000},
        {"ARM64", "arm64_32", 0x180000000, 0x100000000},
        {"ARM", "with arm64_32 ones", 0x1A000000, 0x40000000},
        {"ARM", "", 0x40000000, 0x40000000},
    };
    const ScriptedKernel kernel;
    std::set<uuid_t> uuids;
    for (const auto& [architecture, images, base, size] : cases) {
        const auto cache = processOf({.architecture = architecture, .binaryImages = images})->sharedCache();
        EXPECT_TRUE(cache->baseAddress == base && cache->mappedSize == size) << architecture;
        EXPECT_EQ(cache->alignment, 4096U);
        uuids.insert(cache->uuid);
    }
    EXPECT_EQ(uuids.size(), std::size(cases));
    testing::internal::CaptureStderr();
    EXPECT_FALSE(processOf({})->sharedCache());
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to determine platform architecture of target\n");
}

TEST(Heapsnap, CountsInsideTheCacheAreBytes) {
    constexpr std::uint64_t page = 16384;
    const auto at = [&](std::uint64_t offset, std::uint64_t pages, const char* type) {
        return QRYVMRegion{.address = cacheBase + offset,
                           .length = pages * page,
                           .type = Name(type),
                           .path = Name("/lib"),
                           .resident_size = pages * page,
                           .swapped_out_size = 0,
                           .dirty_size = pages * page / 2};
    };
    const ScriptedKernel kernel;
    const auto process = processOf({.architecture = "X86-64",
                                    .vmPageSize = page,
                                    .regions = {at(0, 16, "__TEXT"), at(16 * page, 16, "__DATA"),
                                                at(32 * page, 2, "__LINKEDIT"), at(40 * page, 2, "memory")}});
    process->gatherData();
    Lines lines;
    for (const TLMemoryRegion& region : process->memoryRegions()) {
        lines.push_back(describe(region));
    }
    EXPECT_EQ(lines, (Lines{"7ff800000000+40000 __TEXT /lib @2", "7ff800040000+40000 __DATA /lib d20000 @3",
                            "7ff800080000+8000 __LINKEDIT dyld shared cache @4",
                            "7ff8000a0000+8000 unused dyld shared cache area @0 gap"}));
}

} // namespace
} // namespace tally
