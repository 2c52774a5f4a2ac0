#include "WalkTest.h"

#include "vm/OwnedObjects.h"

#include <cerrno>

namespace tally {
namespace {

using namespace platform;

class OwnedMemory : public WalkTest {};

TEST_F(OwnedMemory, IsChargedWhereItIsMappedFirstElseUnmapped) {
    task.owned = {{9, 0x9000, 0x5000, 0, 0x1000, 0x2000},
                  {2, 0x2000, 0x2000, 0x800, 0x300, 0x700, false, 4, VM_PURGABLE_VOLATILE},
                  {3, 0x3000, 0x3000, 0x10, 0x100, 0, /*noTally=*/true},
                  {4, 0, 0x100, 0, 0x200, 0, false, 7},
                  {5, 0, 0x7000, 0}};
    task.map({.tag = 90, .pages = "DDC", .object = 9});
    task.map({.tag = 90, .pages = "DDC", .object = 9, .shareMode = SM_PRIVATE});
    task.map({.tag = 67, .pages = "DDC", .object = 2});
    task.map({.pages = "D", .object = 5, .file = "/f"}); // a file's mapping shows no owned object
    task.map({.tag = TLUnmappedTag, .pages = "DDDD"});   // the list says it in more detail
    EXPECT_EQ(walkedLines(),
              (Lines{"10000+3000 audio d4000 s2000 r1000 owned", "13000+3000 audio d2000 c1000",
                     "16000+3000 OpenCL (graphics) d800 r300 owned", "19000+1000 mapped file /f d1000",
                     "unmapped+3000 Owned physical tally (unmapped) r100 w3000 owned",
                     "unmapped+0 Owned physical tally (unmapped) (VM ledger tag 7) r200 owned",
                     "unmapped+0 Owned physical tally (unmapped) d7000 owned"}));
    setPhysTallyCollectionEnabled(0); // no list, and nobody is charged
    EXPECT_EQ(walkedLines().at(0), "10000+3000 audio d3000");
}

TEST_F(OwnedMemory, IsNotListedWhereThereIsNoList) {
    walk();
    WalkedTask walked = process->makeWalk();
    testing::internal::CaptureStderr();
    for (const int error : {ENOENT, EPERM}) {
        kernel.fail("sysctl_owned_vmobjects", error);
        EXPECT_FALSE(gatherOwnedVmObjects(walked));
    }
    const std::string warning = "p [7]: vm.get_owned_vmobjects - Operation not permitted";
    EXPECT_EQ(process->warnings(), (Lines{warning}));
    EXPECT_EQ(testing::internal::GetCapturedStderr(), warning + "\n");
    task.owned->clear();
    EXPECT_TRUE(gatherOwnedVmObjects(walked)) << "an empty list is one";
}

} // namespace
} // namespace tally
