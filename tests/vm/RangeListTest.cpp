#include "vm/TLRangeList.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <random>
#include <vector>

namespace tally {
namespace {

struct Range {
    std::uint64_t start = 0;
    std::uint64_t size = 0;
    std::uint64_t dirty = 0;

    friend bool operator==(const Range&, const Range&) = default;
};
using Ranges = std::vector<Range>;

Ranges rangesOf(const TLRangeList& list) {
    Ranges ranges;
    for (const auto* node = list.rangeListHead(); node != nullptr; node = node->next.get()) {
        ranges.push_back({node->start, node->size, node->sizes.dirty});
    }
    return ranges;
}

// Ranges whose pages are dirty throughout make an exact union, whatever the order of insertion and wherever
// they begin inside a page: a bitmap says the same. Counters that say less than their range stay between the
// largest of them and the sum of all.
TEST(RangeList, AgreesWithABitmap) {
    constexpr std::uint64_t page = 0x1000;
    for (std::uint32_t seed = 0; seed < 4000; ++seed) {
        const bool isLong = seed % 32 == 0; // then the list makes an index
        const std::size_t pages = isLong ? 3000 : 96;
        std::mt19937 random(seed);
        const auto upTo = [&](std::uint64_t limit) { return random() % (limit + 1); };
        std::vector<bool> covered(pages);
        std::vector<std::uint64_t> firstByte(pages, ~0ull); // of the ranges that begin in a page
        std::vector<std::uint64_t> endByte(pages, 0);       // of those that end in it
        std::uint64_t largest = 0;
        std::uint64_t sum = 0;
        TLRangeList list;
        for (std::uint64_t left = 1 + upTo(isLong ? 400 : 30); left > 0; --left) {
            const std::uint64_t first = upTo(pages - 1);
            const std::uint64_t last = std::min(first + upTo(9), pages - 1);
            const std::uint64_t start = first * page + upTo(0x7ff);
            const std::uint64_t end = last * page + 0x800 + upTo(0x800);
            for (std::uint64_t i = first; i <= last; ++i) {
                covered[i] = true;
            }
            firstByte[first] = std::min(firstByte[first], start);
            endByte[last] = std::max(endByte[last], end);
            const std::uint64_t bytes = (last - first + 1) * page;
            const std::uint64_t swapped = upTo(bytes);
            largest = std::max(largest, swapped);
            sum += swapped;
            list.addSubrange(start, end - start, page, {.dirty = bytes, .swapped = swapped});
        }
        Ranges expected;
        for (std::size_t i = 0; i < pages; ++i) {
            if (covered[i] && (i == 0 || !covered[i - 1])) {
                expected.push_back({firstByte[i], 0, 0});
            }
            if (covered[i]) {
                expected.back().dirty += page;
                expected.back().size = endByte[i] - expected.back().start;
            }
        }
        ASSERT_EQ(rangesOf(list), expected) << "seed " << seed;
        const std::uint64_t swapped = list.sumSizes().swapped;
        ASSERT_TRUE(largest <= swapped && swapped <= sum) << "seed " << seed;
    }
}

// A quadratic walk would take hours here, and a recursive end of the chain would use up the stack.
TEST(RangeList, TakesAndFreesManyRanges) {
    constexpr std::uint64_t count = 200'000;
    for (const std::uint64_t stride : {1, 77'777}) { // in order, and all over the object
        TLRangeList list;
        for (std::uint64_t i = 0; i < count; ++i) {
            list.addSubrange(i * stride % count * 0x2000, 0x800, 0x1000, {.wired = 1});
        }
        EXPECT_EQ(list.sumSizes(), (TLRangeSizes{.wired = count}));
        EXPECT_EQ(rangesOf(list).size(), count);
    }
}

} // namespace
} // namespace tally
