// The decoders of the kernel's texts, with the odd lines that real machines show.

#include "platform/linux/machine/MachineState.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/objects/Executable.h"
#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/pages/DecodeMaps.h"
#include "platform/linux/walk/CountedPages.h"

#include <gtest/gtest.h>

#include <random>
#include <set>

namespace tally::platform {
namespace {

TEST(DecodeMaps, ReadsWhateverAPathHolds) {
    struct Case {
        const char* line;
        const char* name; // null: no mapping
    };
    const Case cases[] = {
        {"00400000-00452000 r-xp 00000000 08:02 173521      /usr/bin/dbus-daemon", "/usr/bin/dbus-daemon"},
        {"7f00-8000 r--p 0 0:0 0", nullptr}, // not whole pages
        {"7f0000000000-7f0000001000 rw-s 00001000 00:01 4096 /memfd:a b (deleted)", "/memfd:a b (deleted)"},
        {"7f0000000000-7f0000001000 rw-p 00000000 00:00 0", ""},
        {"7f0000000000-7f0000001000 rw-p 00000000 00:00 0 ", ""},
        {"7f0000000000-7f0000001000 r--p 00000000 fe:00 7 /tmp/two\\012lines \xff (deleted)",
         "/tmp/two\nlines \xff (deleted)"},
        {"7ffff7ff0000-7ffff7fff000 r-xp 00000000 00:00 0 [vdso]", "[vdso]"},
        {"2000-1000 r--p 00000000 00:00 0", nullptr}, // ends before it begins
        {"1000-2000 r-- 00000000 00:00 0", nullptr},
        {"1000-2000 r--p 00000000 00 0", nullptr},
        {"100000000000000000-2000 r--p 0 00:00 0", nullptr}, // more than 64 bits
        {" 1000-2000 r--p 00000000 00:00 0", nullptr},
        {"Rss:                   4 kB", nullptr},
        {"", nullptr},
    };
    for (const Case& c : cases) {
        Mapping mapping;
        EXPECT_EQ(decodeMapsLine(c.line, &mapping), c.name != nullptr) << c.line;
        if (c.name != nullptr) {
            EXPECT_EQ(mapping.name, c.name);
        }
    }
    std::vector<Mapping> two;
    decodeMaps("1000-2000 rw-s 00003000 fd:10 9 /a\n", &two);
    decodeMaps("ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0 [vsyscall]\n"
               "3000-4000 ---p 00000000 00:00 0",
               &two);
    ASSERT_EQ(two.size(), 2U);
    EXPECT_TRUE(two[0].shared && two[0].writable && two[0].readable && !two[0].executable);
    EXPECT_EQ(two[0].fileOffset, 0x3000U);
    EXPECT_EQ(two[0].deviceMajor, 0xfdU);
    EXPECT_EQ(two[0].deviceMinor, 0x10U);
    EXPECT_TRUE(two[1].isPrivateAnonymous());
}

TEST(DecodeAuxiliary, TellsTheClassOfAProgram) {
    const auto vector = [](auto type, auto value) { // the type of a 64-bit or of a 32-bit word
        const decltype(type) words[] = {6, 4096, type, value, 0, 0};
        return std::string(reinterpret_cast<const char*>(words), sizeof words);
    };
    EXPECT_EQ(decodeIs64bit(vector(std::uint64_t{4}, std::uint64_t{56})), true);
    EXPECT_EQ(decodeIs64bit(vector(std::uint32_t{4}, std::uint32_t{32})), false);
    EXPECT_EQ(decodeIs64bit(vector(std::uint64_t{3}, std::uint64_t{64})), std::nullopt);
    EXPECT_EQ(decodeIs64bit(""), std::nullopt);
}

TEST(DecodeSmaps, TakesTheFiguresOfEachMapping) {
    std::vector<SmapsEntry> entries;
    for (const char* lines : {"Rss: 4 kB\n1000-3000 rw-p 00000000 00:00 0\n"
                              "KernelPageSize:        4 kB\nRss:  8 kB\nAnonymous: 8 kB\n"
                              "LazyFree:  4 kB\nSwap: 12 kB\nSwapPss: 3 kB\n",
                              "VmFlags: rd wr mr lo ac\n3000-4000 rw-s 00000000 00:01 7 /x\n"
                              "Shared_Dirty: 4 kB\nPrivate_Dirty: 8 kB\nRss: x kB\n"
                              "Private_Hugetlb: 2048 kB\nVmFlags: rd look"}) {
        decodeSmaps(lines, &entries);
    }
    ASSERT_EQ(entries.size(), 2U);
    EXPECT_EQ(entries[0].resident, 8192U);
    EXPECT_EQ(entries[0].lazyFree, 4096U);
    EXPECT_EQ(entries[0].swapped, 12288U);
    EXPECT_TRUE(entries[0].locked);
    EXPECT_EQ(entries[1].dirty, 12288U);
    EXPECT_EQ(entries[1].hugetlb, 2097152U);
    EXPECT_EQ(entries[1].resident, 0U);
    EXPECT_FALSE(entries[1].locked);
}

TEST(DecodeStat, FindsItsFieldsBehindAnyName) {
    const std::string rest = " 7 7 7 0 -1 4194560 1 2 3 4 5 6 7 8 20 0 3 0 991 10000 20";
    for (const std::string name : {"sh", "a) R 1 (b", "two words", "", ")"}) {
        const std::optional<ProcessStat> stat = decodeStat("42 (" + name + ") S 7" + rest.substr(2));
        ASSERT_TRUE(stat) << name;
        EXPECT_EQ(stat->comm, name);
        EXPECT_EQ(stat->parent, 7);
        EXPECT_EQ(stat->threads, 3);
        EXPECT_EQ(stat->startTicks, 991U);
        EXPECT_FALSE(stat->isKernelThread());
    }
    EXPECT_FALSE(decodeStat(""));
    EXPECT_FALSE(decodeStat("42 (sh) S 7 7"));
    EXPECT_FALSE(decodeStat("42 )sh( S 7" + rest));
    EXPECT_TRUE(decodeStat("9 (w) Z 1 0 0 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 5")->isZombie());
    EXPECT_FALSE(decodeStat("9 (w) Z 1 0 0 0 -1 0 0 0 0 0 0 0 0 0 20 0 2 0 5")->isZombie());
}

TEST(DecodeStatus, SumsWhatIsThereAndKnowsAProcessThatHasEnded) {
    const ProcessStatus status =
        decodeStatus("Name:\tRssAnon: 9 kB\nTgid:\t12\nVmHWM:\t  100 kB\nVmLck:\t 8 kB\n"
                     "RssAnon:\t 16 kB\nRssShmem:\t 4 kB\nVmPTE:\t 40 kB\nVmSwap:\t 0 kB\n"
                     "HugetlbPages:\t 2048 kB\n");
    EXPECT_EQ(status.residentAnonymous, 16384U);
    EXPECT_EQ(status.pageTables, 40960U);
    EXPECT_EQ(status.hugetlb, 2097152U);
    EXPECT_EQ(status.locked, 8192U);
    EXPECT_TRUE(status.hasAddressSpace);
    EXPECT_FALSE(decodeStatus("Name:\tx\nState:\tZ (zombie)\nTgid:\t3\n").hasAddressSpace);
}

TEST(MachineState, TellsLazilyFreedMemoryFromTheListsAndSwapFromTheTotals) {
    const std::string head = "nr_inactive_anon 7\nnr_inactive_file 1000000\nnr_active_file 500\n";
    EXPECT_EQ(decodeLazyFree(head + "nr_file_pages 700\nnr_shmem 150\nnr_swapcached 50\n"),
              1000000U * basePage);
    EXPECT_EQ(decodeLazyFree(head + "nr_file_pages 2000000\nnr_shmem 150\nnr_swapcached 50\n"), 0U);
    EXPECT_EQ(decodeLazyFree(""), 0U);
    EXPECT_TRUE(decodeSwapInUse("MemTotal: 9 kB\nSwapTotal:  100 kB\nSwapFree:  96 kB\n"));
    EXPECT_FALSE(decodeSwapInUse("SwapTotal:  100 kB\nSwapFree:  100 kB\n"));
}

TEST(ObjectId, TellsObjectsApart) {
    std::set<std::uint64_t> ids;
    for (const bool isSysV : {false, true}) {
        for (const std::uint64_t device : {1U, 27U}) {
            for (const std::uint64_t inode : {1U, 98325U}) {
                ids.insert(objectIdOfFile({.device = device, .inode = inode, .isSysV = isSysV}));
            }
        }
    }
    for (const std::uint64_t start : {0x1000U, 0x2000U}) {
        ids.insert(objectIdOfTaskMemory(1, 98325, start));
        ids.insert(objectIdOfTaskMemory(98325, 1, start));
    }
    EXPECT_EQ(ids.size(), 12U);
    EXPECT_FALSE(ids.contains(0));
}

TEST(CountedPages, TakesEveryPageOnceLikeABitmap) {
    std::mt19937 random(20260);
    const auto number = [&](std::uint64_t below) { return random() % below; };
    for (int round = 0; round < 2000; ++round) {
        constexpr std::uint64_t size = 96;
        std::vector<PageRange> ranges;
        CountedPages counted;
        for (std::uint64_t i = 0, count = 1 + number(6); i < count; ++i) {
            const std::uint64_t first = number(size);
            ranges.push_back({first, first + 1 + number(size - first)});
            counted.expect(7, ranges.back());
            counted.expect(8, {100 * i, 100 * i + 50}); // never overlaps itself
        }
        counted.prepare();
        std::vector<bool> bitmap(size + 1);
        for (const PageRange& range : ranges) {
            // A mapping takes runs of its range, in rising order.
            for (std::uint64_t first = range.first; first < range.end;) {
                const PageRange run{first, std::min(range.end, first + 1 + number(9))};
                std::vector<PageRange> fresh;
                counted.take(7, run, &fresh);
                std::vector<bool> taken(size + 1);
                for (const PageRange& part : fresh) {
                    for (std::uint64_t page = part.first; page < part.end; ++page) {
                        ASSERT_FALSE(taken[page]);
                        taken[page] = true;
                    }
                }
                for (std::uint64_t page = 0; page <= size; ++page) {
                    const bool isFresh = page >= run.first && page < run.end && !bitmap[page];
                    ASSERT_EQ(taken[page], isFresh) << page;
                    bitmap[page] = bitmap[page] || isFresh;
                }
                first = run.end + number(4);
            }
        }
        std::vector<PageRange> fresh;
        counted.take(8, {0, 50}, &fresh);
        ASSERT_EQ(fresh.size(), 1U);
    }
}

} // namespace
} // namespace tally::platform
