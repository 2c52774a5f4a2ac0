#include "WalkTest.h"

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t base = 0x180000000;
const std::string unused = " unused dyld shared cache area ";

/// Task 7 maps a cache of pages of 16 KiB.
class SharedCachePieces : public WalkTest {
  protected:
    SharedCachePieces() {
        kernel.pageSize = 0x4000;
        task.sharedCache = dyld_shared_cache{.uuid = {7}, .base_address = base, .mapped_size = 0x40000};
    }

    /// The pieces of a mapping at the cache's base, without the base, when `segments` are loaded from there
    /// on.
    Lines piecesOf(const char* pages, const std::vector<RKSegment>& segments, bool hidden = false) {
        task.map({.start = base, .pages = pages, .object = 5, .offset = 0x100, .externalPager = true});
        for (const RKSegment& segment : segments) {
            task.images.push_back({"/lib", base, {{base + segment.start, segment.size, segment.name}}});
        }
        Lines lines = walkedLines(hidden);
        for (std::string& line : lines) {
            line.erase(0, 4); // "1800"
        }
        task.unmap(base);
        task.images.clear();
        return lines;
    }
};

// A gap's last page is settled by the data after it, whose own last page is not asked for again. The last
// piece takes the padding up to its alignment; the gap after it is whole pages, so nothing is asked.
TEST_F(SharedCachePieces, ShareThePagesInWhichTheyMeetToTheByte) {
    EXPECT_EQ(piecesOf("DDSD", {{0, 0x3000, "__TEXT"}, {0x5000, 0x4000, "__DATA"}, {0x9000, 0x2800, "__B"}}),
              (Lines{"00000+3000 __TEXT /lib @2", "03000+2000" + unused + "d1000 @3 gap",
                     "05000+4000 __DATA /lib d3000 s1000 @3", "09000+3000 __B /lib s3000 @3",
                     "0c000+4000" + unused + "@3 gap"}));
    EXPECT_EQ(process->memoryRegions()[2].offset, 0x5100u);
    EXPECT_EQ(kernel.callCount("mach_vm_page_range_query"), 1u);
}

TEST_F(SharedCachePieces, AreCutAndSizedByTheirImages) {
    // Three pieces in one page.
    EXPECT_EQ(piecesOf("DC", {{0, 0x1000, "__DATA"}, {0x2000, 0x6000, "__DATA"}}),
              (Lines{"00000+1000 __DATA /lib d1000 @3", "01000+1000" + unused + "d1000 @3 gap",
                     "02000+6000 __DATA /lib d2000 @3"}));
    // No padding where the next image does not begin at the alignment.
    EXPECT_EQ(piecesOf("D", {{0, 0x800, "__A"}, {0x840, 0x37c0, "__B"}}),
              (Lines{"00000+800 __A /lib d800 @3", "00800+40" + unused + "d40 @3 gap",
                     "00840+37c0 __B /lib d37c0 @3"}));
    // Anonymous pages are dirty, clean ones of a file are not counted.
    EXPECT_EQ(piecesOf("CAS", {{0, 0xc000, "__DATA"}}), Lines{"00000+c000 __DATA /lib d4000 s4000 @3"});
    // A gap beside text is text's unless data follows it; text and symbols are never asked for.
    EXPECT_EQ(
        piecesOf("DD", {{0x1000, 0x1000, "__LINKEDIT"}, {0x3000, 1, "__TEXT"}, {0x5000, 0x3000, "__C"}}),
        (Lines{"00000+1000" + unused + "@4 gap", "01000+1000 __LINKEDIT dyld shared cache @4",
               "02000+1000" + unused + "@4 gap", "03000+1000 __TEXT /lib @2",
               "04000+1000" + unused + "d1000 @3 gap", "05000+3000 __C /lib d3000 @3"}));
    // Text between a gap and the data that would settle it: the gap's last page stays unknown.
    EXPECT_EQ(piecesOf("DD", {{0, 0x1000, "__A"}, {0x4800, 0x800, "__TEXT"}, {0x5000, 0x3000, "__B"}}),
              (Lines{"00000+1000 __A /lib d1000 @3", "01000+3800" + unused + "d3000 @3 gap",
                     "04800+800 __TEXT /lib @2", "05000+3000 __B /lib d3000 @3"}));
    // Images that overlap or are empty end the walk all the same.
    EXPECT_EQ(piecesOf("D", {{0, 0x800, "MACH_HEADER"}, {0, 0x900, "__TEXT"}, {0x2000, 0, "__DATA"}}),
              (Lines{"00000+1000 __TEXT /lib @2", "01000+3000" + unused + "@2 gap"}));
    EXPECT_EQ(piecesOf("D", {}), Lines{"00000+4000" + unused + "@0 gap"});
    EXPECT_EQ(piecesOf("DD", {{0, 0x4000, "__DATA"}}, true), Lines{}) << "hidden processes show none";
}

TEST_F(SharedCachePieces, EndTheWalkWhenTheirPagesCannotBeRead) {
    task.map({.start = base + 0x100000, .pages = "D"});
    kernel.fail("mach_vm_page_range_query", KERN_FAILURE);
    testing::internal::CaptureStderr();
    EXPECT_EQ(piecesOf("DD", {{0, 0x4000, "__TEXT"}, {0x4000, 0x4000, "__DATA"}}),
              Lines{"00000+4000 __TEXT /lib @2"});
    EXPECT_TRUE(testing::internal::GetCapturedStderr().ends_with(
        "\nbailing out for process p [7]; data may be incomplete!\n"));
}

} // namespace
} // namespace tally
