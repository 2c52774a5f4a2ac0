// What is kept for the whole run: the accounting switch, shared caches, tag names.

#include "platform/mach_task.h"
#include "platform/scripted/ScriptedKernel.h"
#include "vm/PhysTallyCollection.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TLSharedCache.h"
#include "vm/TagNames.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <set>

namespace tally {
namespace {

using namespace platform;

TEST(AccountingSwitch, IsAskedOnceAndAgainAfterItWasWritten) {
    ScriptedKernel kernel;
    setPhysTallyCollectionEnabled(1);
    EXPECT_TRUE(physTallyCollectionEnabled());
    kernel.selfRegionTally = 0; // behind the tool's back
    EXPECT_TRUE(physTallyCollectionEnabled());
    for (const int error : {ENOENT, EPERM}) {
        kernel.fail("sysctlbyname_write", error);
        kernel.fail("sysctlbyname_read", error);
        testing::internal::CaptureStderr();
        setPhysTallyCollectionEnabled(1);
        EXPECT_FALSE(physTallyCollectionEnabled());
        EXPECT_EQ(testing::internal::GetCapturedStderr(),
                  error == ENOENT
                      ? ""
                      : "Unable to configure physical tally data collection: Operation not permitted\n"
                        "Unable to retrieve status of physical tally data collection: Operation not "
                        "permitted\n");
    }
}

TEST(SharedCache, IsOneRecordPerCacheAndBase) {
    ScriptedKernel kernel;
    ScriptedTask& task = kernel.addTask({.pid = 1});
    mach_port_t port = MACH_PORT_NULL;
    task_read_for_pid(1, &port);
    const PortRight right(port);
    task.sharedCache = {.uuid = {1, 2}, .base_address = 0x180000000, .mapped_size = 0x10000};
    const auto record = TLSharedCache::sharedCacheForTask(port);
    ASSERT_TRUE(record && record->contains(0x18000ffff));
    EXPECT_FALSE(record->contains(0x180010000) || record->contains(0x17fffffff));
    task.sharedCache->base_address += 0x1000;
    EXPECT_NE(TLSharedCache::sharedCacheForTask(port), record);
    task.sharedCache->mapped_private = true;
    EXPECT_FALSE(TLSharedCache::sharedCacheForTask(port));
    testing::internal::CaptureStderr();
    task.cacheSnapshotStatus = KERN_FAILURE;
    EXPECT_FALSE(TLSharedCache::sharedCacheForTask(port));
    task.cacheProcessStatus = KERN_FAILURE;
    EXPECT_FALSE(TLSharedCache::sharedCacheForTask(port));
    const std::string reason = mach_error_string(KERN_FAILURE);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "Unable to create dyld process snapshot: " + reason +
                                                          "Unable to create dyld process: " + reason);
}

TEST(TagNames, ComeFromTheTableTheLibraryOrTheNumber) {
    ScriptedKernel kernel;
    kernel.tagDescriptions = {{1, "never asked"}, {12, "arena"}, {13, "Memory Tag 13"}, {256, "no tag"}};
    std::string text;
    for (const std::uint32_t tag : {0u, 1u, 12u, 13u, 240u, 255u, 256u, 0xFFFFFFFEu, TLUnmappedTag}) {
        text += std::string(nameForTag(tag).view()) + "; ";
    }
    EXPECT_EQ(text,
              "untagged (\"VM_ALLOCATE\"); malloc metadata; arena; tag 13; app-specific tag 1; app-specific "
              "tag 16; tag 256; tag -2; Owned physical tally (unmapped); ");
    EXPECT_TRUE(nameForLedgerTag(1).isNull());
    EXPECT_EQ(nameForLedgerTag(5).view(), "neural");
    EXPECT_EQ(nameForLedgerTag(6).view(), "VM ledger tag 6");
    std::set<std::string_view> named;
    for (std::uint32_t tag = 0; tag < 240; ++tag) {
        const std::string_view name = nameForTag(tag).view();
        named.insert(name.starts_with("tag ") ? "" : name);
    }
    EXPECT_EQ(named.size(), 77u)
        << "75 of the table, one of the library, none; two of a name would be one row";
}

} // namespace
} // namespace tally
