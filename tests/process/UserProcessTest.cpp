#include "WalkTest.h"
#include "process/LedgerLayout.h"

#include <cerrno>
#include <thread>

namespace tally {
namespace {

using namespace platform;

class UserProcess : public WalkTest {
  protected:
    UserProcess() {
        task.usage = {.ri_phys_tally = 100, .ri_lifetime_max_phys_tally = 200};
        task.ledger = {{"page_table", 0x3000}};
        task.map({.tag = 30, .pages = "D"});
    }

    const Lines stackOnly = {"10000+1000 stack d1000"};
    const Lines stackAndPageTable = {"10000+1000 stack d1000", "unmapped+3000 page table d3000"};
};

TEST_F(UserProcess, IsGatheredOnceIntoRegionsAuxDataAndNotices) {
    task.notices = {.of_task = {"first"}, .of_machine = {"second"}};
    const auto made = TLProcess::processWithPid(7);
    EXPECT_FALSE(made->hasMemoryRegions());
    task.usage.ri_phys_tally = 150; // asked for again
    made->gatherData();
    EXPECT_EQ(made->memoryRegions().at(1).object_id, TLNotSet);
    EXPECT_EQ(made->memoryRegions().at(1).share_mode, SM_PRIVATE);
    EXPECT_EQ(made->warnings(), (Lines{"first", "second"}));
    EXPECT_EQ(made->auxData(), (TLAuxDictionary{{{"phys_tally", TLAuxData(150, false)},
                                                 {"phys_tally_peak", TLAuxData(200, false)}}}));
    task.map({.pages = "D"});
    made->gatherData();
    EXPECT_EQ(made->memoryRegions().size(), 2u) << "gathered once";
    task.usage.ri_phys_tally = 0;
    EXPECT_FALSE(TLProcess::processWithPid(7)->auxData());

    kernel.fail("sysctl_owned_vmobjects", EPERM);
    walk(/*hidden=*/true);
    EXPECT_TRUE(process->warnings().empty()) << "of a hidden one no owned objects are asked for";
    process.reset();
    EXPECT_EQ(kernel.heldPortReferences(), 1u) << "of the one that is left";
}

TEST_F(UserProcess, HasNoPageTablesWhereTheLedgerTellsNone) {
    kernel.fail("ledger_entries", EPERM);
    testing::internal::CaptureStderr();
    const std::string warning = "p [7]: Unable to retrieve ledger entry info - Operation not permitted";
    EXPECT_EQ(walkedLines(), (Lines{stackOnly[0], warning}));
    EXPECT_EQ(testing::internal::GetCapturedStderr(), warning + "\n");
    EXPECT_EQ(walkedLines(), stackAndPageTable);
    EXPECT_EQ(walkedLines(false, /*alive=*/false), stackOnly) << "not a process: never asked";
    task.ledger["page_table"] = -5;
    EXPECT_EQ(walkedLines(), stackOnly);
    setPhysTallyCollectionEnabled(0);
    task.ledger["page_table"] = 5;
    EXPECT_EQ(walkedLines(), stackOnly);
}

TEST(Ledger, IsLaidOutByName) {
    ScriptedKernel kernel;
    kernel.ledgerTemplate = {"phys_tally", "page_tables", "page_table", "page_table", "page_table"};
    EXPECT_EQ(readLedgerLayout().pageTable, 3u) << "a later one counts, up to the third match";
    kernel.ledgerTemplate.assign(160, "x"); // exactly as many as the second request
    kernel.ledgerTemplate.emplace_back("page_table");
    EXPECT_EQ(readLedgerLayout().entryCount, 161u);
    EXPECT_EQ(readLedgerLayout().pageTable, 160u);
    kernel.fail("ledger_template", EPERM);
    testing::internal::CaptureStderr();
    EXPECT_FALSE(readLedgerLayout().entryCount);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to retrieve ledger template info: Operation not permitted\n");
}

// Every table that is kept for the run is filled here by several threads at once.
TEST(ThreadGather, OfManyProcessesAtOnce) {
    ScriptedKernel kernel;
    setPhysTallyCollectionEnabled(1);
    std::vector<std::shared_ptr<TLProcess>> processes(6);
    std::vector<std::jthread> threads;
    for (std::size_t i = 0; i < processes.size(); ++i) {
        ScriptedTask& task = kernel.addTask({.pid = static_cast<std::int32_t>(i), .name = "p"});
        task.sharedCache = dyld_shared_cache{.uuid = {3}, .base_address = 0x180000000, .mapped_size = 0x2000};
        task.images = {{"/lib", 0x180000000, {{0x180000000, 0x1800, "__DATA"}}}};
        task.map({.pages = "D.C", .object = 5, .file = "/shared"});
        task.map({.tag = 240, .pages = "D"});
        task.map({.start = 0x180000000, .pages = "DD"});
    }
    for (std::size_t i = 0; i < processes.size(); ++i) {
        threads.emplace_back([&process = processes[i], pid = static_cast<std::int32_t>(i)] {
            process = TLProcess::processWithPid(pid);
            process->gatherData();
        });
    }
    threads.clear();
    for (const auto& process : processes) {
        ASSERT_EQ(process->memoryRegions().size(), 3u);
        EXPECT_EQ(process->memoryRegions()[2].fullName(), "__DATA /lib");
        EXPECT_EQ(process->sharedCache(), processes[0]->sharedCache());
    }
}

} // namespace
} // namespace tally
