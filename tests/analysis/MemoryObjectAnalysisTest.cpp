#include "analysis/ReadyProcess.h"

namespace tally {
namespace {

constexpr auto none = TLSegmentKind::none;
constexpr auto text = TLSegmentKind::text;
constexpr auto data = TLSegmentKind::data;
constexpr auto linkedit = TLSegmentKind::linkedit;

RegionRecord ordinary(std::uint64_t object, TLSegmentKind segment = none) {
    return {.object = object, .segment = segment};
}

RegionRecord cached(std::uint64_t start, TLSegmentKind segment, std::uint64_t dirty, std::uint64_t swapped) {
    RegionRecord record = {.object = start, .dirty = dirty, .swapped = swapped, .start = start};
    record.segment = segment;
    record.inSharedCache = true;
    return record;
}

std::shared_ptr<const TLSharedCache> cacheAt(std::uint64_t base, std::uint8_t uuid) {
    return std::make_shared<TLSharedCache>(TLSharedCache{.uuid = {uuid}, .baseAddress = base * page});
}

TEST_F(AnalysisTest, RegionsOfTwoProcessesShareAnObject) {
    struct {
        const char* name;
        RegionRecord a, b; // the process of a maps cache 1 at page 0x100
        bool share;
        std::uint64_t baseOfB = 0x100;
        std::uint8_t cacheOfB = 1;
    } const cases[] = {
        {"same id", ordinary(7), ordinary(7), true},
        {"other id", ordinary(7), ordinary(7 << 8), false},
        {"no object", ordinary(0), ordinary(0), false},
        {"page tables", ordinary(TLNotSet), ordinary(TLNotSet), false},
        {"text, ordinary", ordinary(7, text), ordinary(7), false},
        {"linkedit, ordinary", ordinary(7, linkedit), ordinary(7), false},
        {"text, linkedit", ordinary(7, text), ordinary(7, linkedit), false},
        {"data, ordinary", ordinary(7, data), ordinary(7), true},
        {"clean data of the cache", cached(0x105, data, 0, 0), cached(0x105, data, 0, 0), true},
        {"the cache's first byte", cached(0x100, none, 0, 0), cached(0x100, none, 0, 0), true},
        {"other place", cached(0x105, data, 0, 0), cached(0x106, data, 0, 0), false},
        {"dirty data", cached(0x105, data, 1, 0), cached(0x105, data, 1, 0), false},
        {"swapped data", cached(0x105, none, 0, 1), cached(0x105, none, 0, 1), false},
        {"dirty text", cached(0x105, text, 1, 0), cached(0x105, text, 0, 1), true},
        {"dirty linkedit", cached(0x105, linkedit, 1, 0), cached(0x105, linkedit, 0, 1), true},
        {"cache elsewhere", cached(0x105, none, 0, 0), cached(0x205, none, 0, 0), true, 0x200},
        {"other cache", cached(0x105, none, 0, 0), cached(0x105, none, 0, 0), false, 0x100, 2},
        {"key is an id", cached(0x105, none, 0, 0), ordinary(5 * page + 1), false},
    };
    for (const auto& pair : cases) {
        const auto a = ready(5, {pair.a});
        const auto b = ready(6, {pair.b});
        a->setSharedCache(cacheAt(0x100, 1));
        b->setSharedCache(cacheAt(pair.baseOfB, pair.cacheOfB));
        TLTally tally({a, b});
        tally.analyzeMemoryObjects();
        EXPECT_EQ(a->memoryRegions()[0].memoryObject == b->memoryRegions()[0].memoryObject, pair.share)
            << pair.name;
    }
}

TEST_F(AnalysisTest, TotalsAreRegionsAsChargedOrWholeObjectsOnce) {
    const auto a = ready(5, {{.object = 7, .size = 4, .dirty = 2, .swapped = 1},
                             {.object = 7, .size = 4, .dirty = 3, .offset = 4},
                             {.size = 9, .dirty = 9}}); // has no object: only charged
    const auto b = ready(6, {{.object = 7, .size = 4, .dirty = 1, .swapped = 3, .offset = 8}});
    const auto hidden = ready(7, {{.object = 7, .size = 1, .dirty = 1, .offset = 20}});
    hidden->setHiddenFromDisplay(true);
    using Totals = std::map<std::int32_t, std::uint64_t>;
    TLTally tally({a, b, hidden});
    tally.analyzeMemoryObjects();
    EXPECT_EQ(tally.pidToTally(), (Totals{{5, 15 * page}, {6, 4 * page}}));
    setPhysTallyCollectionEnabled(0);
    tally.analyzeMemoryObjects();
    EXPECT_EQ(tally.pidToTally(), (Totals{{5, 11 * page}, {6, 11 * page}}));
    b->setHiddenFromDisplay(true);
    tally.analyzeMemoryObjects(); // replaces what was there
    EXPECT_EQ(tally.pidToTally(), (Totals{{5, 11 * page}}));
}

} // namespace
} // namespace tally
