#include "platform/scripted/ScriptedKernel.h"
#include "process/SnapshotCapture.h"
#include "process/TLHeapsnapProcess.h"
#include "process/WalkTest.h"

#include <filesystem>
#include <fstream>

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t cacheBase = 0x7FF800000000;

std::shared_ptr<TLHeapsnapProcess> processOf(QRYSnapshot snapshot) {
    return TLHeapsnapProcess::initWithGraph(std::make_unique<QRYProcessObjectGraph>(std::move(snapshot)));
}

class Heapsnap : public testing::Test {
  protected:
    Lines linesOf(QRYSnapshot snapshot) {
        process = processOf(std::move(snapshot));
        process->gatherData();
        Lines lines;
        for (const TLMemoryRegion& region : process->memoryRegions()) {
            lines.push_back(describe(region));
        }
        return lines;
    }

    ScriptedKernel kernel;
    std::shared_ptr<TLHeapsnapProcess> process;
};

TEST_F(Heapsnap, TakesAllFromTheSnapshotAndNothingFromTheLiveProcess) {
    kernel.addTask({.pid = 9, .name = "live", .usage{.ri_phys_tally = 1}});
    setPhysTallyCollectionEnabled(1);
    const std::size_t callsBefore = kernel.callCount("task_read_for_pid");
    const auto lines = linesOf({.pid = 9,
                                .processName = "saved",
                                .is64bit = false,
                                .isTranslated = true,
                                .architecture = "X86-64",
                                .vmPageSize = 16384,
                                .physicalTally = 70,
                                .physicalTallyPeak = 90,
                                .showsPhysTally = false});
    EXPECT_EQ(lines, Lines());
    EXPECT_EQ(process->displayString(), "saved [9] (heapsnap)");
    EXPECT_TRUE(!process->is64bit() && process->isTranslated() && !process->breakDownPhysTally());
    EXPECT_EQ(process->pageSize(), 16384U);
    EXPECT_EQ(process->idleExitStatus(), TLIdleExitStatus::unknown);
    EXPECT_EQ(process->auxData()->entries.at("phys_tally").leaf().value(), 70);
    for (const char* call :
         {"task_read_for_pid", "proc_pid_rusage", "ledger_entries", "sysctl_owned_vmobjects"}) {
        EXPECT_EQ(kernel.callCount(call), callsBefore) << call;
    }
}

TEST_F(Heapsnap, MakesASharedCacheOfItsArchitecture) {
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

TEST_F(Heapsnap, RegionsAreNamedAndSizedAsTheWalkDoes) {
    constexpr std::uint64_t page = 16384;
    const QRYVMRegion base{
        .length = 16 * page, .resident_size = 10 * page, .swapped_out_size = page, .dirty_size = 8 * page};
    const auto at = [&](std::uint64_t address, const char* type, const char* path = nullptr) {
        QRYVMRegion region = base;
        region.address = address;
        region.type = Name(type);
        region.path = path == nullptr ? Name() : Name(path);
        return region;
    };
    QRYSnapshot snapshot{.architecture = "X86-64", .vmPageSize = page};
    auto& regions = snapshot.regions;
    regions = {at(0x100000, "__TEXT", "/bin/x"),
               at(0x140000, "__DATA", "/bin/x"),
               at(0x180000, "memory", "/f"),
               at(0x1c0000, "mapped file", "/f"),
               at(0x200000, "commpage (reserved)"),
               at(0x240000, "memory"),
               at(0x280000, "memory")};
    regions[3].external_pager = 1;
    regions[3].reusable_size = page;
    regions[5].user_tag = 30;
    regions[5].is_wired = true;
    regions[6].purgeable = VM_PURGABLE_VOLATILE;
    EXPECT_EQ(linesOf(snapshot), (Lines{"100000+40000 __TEXT /bin/x d20000 s4000 c8000 #2",
                                        "140000+40000 __DATA /bin/x d20000 s4000 c8000 #3",
                                        "180000+40000 untagged (\"VM_ALLOCATE\") d20000 s4000 c8000",
                                        "1c0000+40000 mapped file /f d20000 s4000 c4000 r4000",
                                        "200000+40000 commpage (reserved) d20000 s4000 c8000 verbose",
                                        "240000+40000 stack d20000 s4000 c8000 w40000",
                                        "280000+40000 untagged (\"VM_ALLOCATE\") r28000 owned"}));
    snapshot.showsPhysTally = false;
    regions = {at(0x180000, "memory")};
    EXPECT_EQ(linesOf(snapshot), (Lines{"180000+40000 untagged (\"VM_ALLOCATE\") d28000 s4000"}))
        << "as the object sees it";
}

TEST_F(Heapsnap, AnObjectIsChargedForItsPagesOnce) {
    constexpr std::uint64_t page = 4096;
    QRYSnapshot snapshot{.pid = 9, .processName = "saved", .architecture = "X86-64", .vmPageSize = page};
    const auto add = [&](std::uint64_t offset, std::uint64_t dirty, std::uint64_t swapped,
                         std::uint64_t object = 7) {
        snapshot.regions.push_back({.address = (snapshot.regions.size() + 1) * 0x10000,
                                    .length = 8 * page,
                                    .type = Name("memory"),
                                    .offset = offset * page,
                                    .resident_size = (dirty + 1) * page,
                                    .swapped_out_size = swapped * page,
                                    .dirty_size = dirty * page,
                                    .object_id = object});
    };
    add(8, 3, 2);                            // pages 8 to 15
    add(8, 2, 3);                            // the same pages: room for 3
    add(0, 5, 0);                            // below them
    add(4, 7, 0);                            // across both, of which 3 are left
    add(4, 7, 0, TLNotSet);                  // of an object that nobody else can have
    add(1 << 20, 7, 0);                      // far away
    add((std::uint64_t{1} << 52) - 4, 7, 0); // to beyond the last offset
    const std::uint64_t dirty[] = {3, 2, 5, 3, 7, 7, 7};
    const std::uint64_t swapped[] = {2, 1, 0, 0, 0, 0, 0};
    for (const bool asCharged : {true, false}) {
        snapshot.showsPhysTally = asCharged;
        linesOf(snapshot);
        for (std::size_t i = 0; i < std::size(dirty) && asCharged; ++i) {
            const TLMemoryRegion& region = process->memoryRegions()[i];
            EXPECT_EQ(region.dirtySize, dirty[i] * page) << i;
            EXPECT_EQ(region.swappedSize, swapped[i] * page) << i;
            EXPECT_EQ(region.cleanNonSpecSize, page) << i;
        }
        EXPECT_EQ(process->warnings().size(), asCharged ? 1U : 0U);
    }
}

TEST_F(Heapsnap, CountsInsideTheCacheAreBytes) {
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
    EXPECT_EQ(linesOf({.architecture = "X86-64",
                       .vmPageSize = page,
                       .regions = {at(0, 16, "__TEXT"), at(16 * page, 16, "__DATA"),
                                   at(32 * page, 2, "__LINKEDIT"), at(40 * page, 2, "memory")}}),
              (Lines{"7ff800000000+40000 __TEXT /lib @2", "7ff800040000+40000 __DATA /lib d20000 @3",
                     "7ff800080000+8000 __LINKEDIT dyld shared cache @4",
                     "7ff8000a0000+8000 unused dyld shared cache area @0 gap"}));
}

TEST_F(Heapsnap, FilesThatAreNoneSayWhy) {
    const std::string folder = testing::TempDir();
    const std::string snapshot = folder + "one.heapsnap";
    const std::string blanks = folder + "blanks.heapsnap";
    std::ofstream(snapshot) << QRYDataWithSnapshot(
        {.pid = 9, .processName = "saved", .architecture = "ARM64"});
    std::ofstream(blanks) << ' ';
    std::filesystem::resize_file(blanks, std::uintmax_t{1} << 40);
    for (const auto& [path, reason] : {std::pair<std::string, const char*>{"/dev/zero", "Invalid argument"},
                                       {"/", "Is a directory"},
                                       {"none", "No such file or directory"},
                                       {"/etc/passwd", "not a heapsnap file: no JSON from byte 1 on"},
                                       {blanks, "File too large"}}) {
        std::optional<TLError> error;
        EXPECT_FALSE(processWithHeapsnap(path, &error));
        EXPECT_EQ(error->message, reason);
        EXPECT_FALSE(processWithHeapsnap(path, nullptr));
    }
    std::optional<TLError> error;
    EXPECT_EQ(processWithHeapsnap(snapshot, &error)->displayString(), "saved [9] (heapsnap)");
    EXPECT_FALSE(error);
    std::filesystem::remove(blanks);
}

/// A process, what its snapshot says, and both as lines.
class Capture : public WalkTest {
  protected:
    /// The process of task 7, captured and read back. @return its regions as lines.
    Lines capturedLines() {
        const auto capture = std::make_shared<SnapshotCapture>();
        proc_bsdinfo info;
        proc_pidinfo(7, &info);
        capture->initWithBsdInfo(info);
        capture->gatherData();
        isComplete = capture->isComplete();
        std::string error;
        auto graph = QRYDirectedGraphWithData(QRYDataWithSnapshot(capture->takeSnapshot()), &error);
        EXPECT_TRUE(graph) << error;
        const auto snapshot = TLHeapsnapProcess::initWithGraph(std::move(graph));
        snapshot->gatherData();
        Lines lines;
        for (const TLMemoryRegion& region : snapshot->memoryRegions()) {
            lines.push_back(describe(region));
            EXPECT_TRUE(region.dirtySize == 0 || region.object_id != 0) << "no row shows " << lines.back();
        }
        EXPECT_EQ(snapshot->auxData(), capture->auxData());
        return lines;
    }

    bool isComplete = false;
};

TEST_F(Capture, SaysWhatTheLiveProcessSays) {
    kernel.tagDescriptions = {{120, "__TEXT of the user"}};
    task.usage = {.ri_phys_tally = 70, .ri_lifetime_max_phys_tally = 90};
    task.images = {{.path = "/bin/x",
                    .base_address = 0x10000,
                    .segments = {{0x10000, 0x2000, "__TEXT"}, {0x12000, 0x1000, "__DATA x"}}}};
    task.map({.start = 0x10000, .pages = "CC", .file = "/bin/x"});
    task.map({.start = 0x12000, .pages = "D"});
    task.map({.start = 0x20000, .tag = 30, .pages = "DDS.", .wiredCount = 1});
    task.map({.start = 0x30000, .tag = 120, .pages = "D"}); // must not become an image
    task.map({.start = 0x40000, .pages = "CCR", .object = 0x77, .offset = 0x3000, .file = "/data"});
    const Lines live = walkedLines();
    EXPECT_EQ(live.size(), 5U);
    EXPECT_EQ(capturedLines(), live);
    EXPECT_TRUE(isComplete);
    setPhysTallyCollectionEnabled(0);
    EXPECT_EQ(capturedLines(), walkedLines());
}

TEST_F(Capture, WritesRunsOfPagesAsRegions) {
    task.map({.start = 0x20000, .pages = "..DDC.S..RD.", .object = 0x99, .offset = 0x5000, .wiredCount = 1});
    EXPECT_EQ(capturedLines(), (Lines{"20000+2000 untagged (\"VM_ALLOCATE\")",
                                      "22000+3000 untagged (\"VM_ALLOCATE\") d2000 c1000 w3000",
                                      "25000+1000 untagged (\"VM_ALLOCATE\")",
                                      "26000+1000 untagged (\"VM_ALLOCATE\") s1000 w1000",
                                      "27000+2000 untagged (\"VM_ALLOCATE\")",
                                      "29000+2000 untagged (\"VM_ALLOCATE\") d1000 r1000 w2000",
                                      "2b000+1000 untagged (\"VM_ALLOCATE\")"}));
}

TEST_F(Capture, SumsUpWhatIsOwnedUnmappedAndKnowsAnEndTooEarly) {
    task.map({.start = 0x20000, .pages = "D"});
    *task.owned = {{.id = 0x1,
                    .virtualSize = 0x5000,
                    .residentSize = 0x3000,
                    .reusableSize = 0x1000,
                    .compressedSize = 0x1000},
                   {.id = 0x2, .virtualSize = 0x2000, .residentSize = 0x2000, .ledgerTag = 4}};
    EXPECT_EQ(capturedLines(), (Lines{"20000+1000 untagged (\"VM_ALLOCATE\") d1000",
                                      "unmapped+7000 Owned physical tally (unmapped) d4000 s1000 r1000"}));
    kernel.before("mach_vm_region_recurse", [this] { task.exit(); }, {.nth = 2});
    testing::internal::CaptureStderr();
    EXPECT_EQ(capturedLines().size(), 2U);
    testing::internal::GetCapturedStderr();
    EXPECT_FALSE(isComplete);
}

} // namespace
} // namespace tally
