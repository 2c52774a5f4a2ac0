// What memory without a name is taken for, on programs that lay it out in these ways, and what is left alone.

#include "platform/linux/tags/Tags.h"
#include "linux/Puppet.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/tags/TagTable.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"
#include "platform/quarry.h"

#include <gtest/gtest.h>

#include <fstream>
#include <set>

namespace tally::platform {
namespace {

using test::Puppet;

void expectTags(const Puppet& puppet) {
    mach_port_t task = MACH_PORT_NULL;
    ASSERT_EQ(task_read_for_pid(puppet.pid(), &task), KERN_SUCCESS);
    const PortRight right(task);
    for (const Puppet::Entry& entry : puppet.ledger()) {
        std::uint64_t start = entry.address;
        std::uint64_t size = 0;
        std::uint32_t depth = 0;
        std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        vm_region_submap_info_64 info;
        ASSERT_EQ(mach_vm_region_recurse(task, &start, &size, &depth, &info, &count), KERN_SUCCESS);
        EXPECT_LE(start, entry.address);
        EXPECT_EQ(std::to_string(info.user_tag), entry.figures.at("tag")) << entry.name;
    }
}

TEST(Tags, MemoryOfTheCLibraryIsToldFromWhatLooksLikeIt) {
    const Puppet puppet({"allocators"}, LAYOUTS_PROGRAM);
    expectTags(puppet);
    // A page that was absent still is: looking at it would have brought it in.
    const Descriptor pagemap = openForReading(processFolder(puppet.pid()) + "/pagemap");
    const auto offset = static_cast<off_t>(puppet.ledger().back().address / 4096 * sizeof(std::uint64_t));
    std::uint64_t entry = 0;
    ASSERT_EQ(pread(pagemap.number(), &entry, sizeof entry, offset), 8);
    EXPECT_EQ(entry >> 63, 0U);
}

TEST(Tags, StacksAreThoseThatThreadsStandOn) { expectTags(Puppet({"threads", "5"}, LAYOUTS_PROGRAM)); }

TEST(Tags, RuntimesAreToldByTheirLibrariesAndPlaces) {
    const test::TemporaryFolder folder;
    for (const char* library : {"/libjvm.so", "/libjemalloc.so.2", "/libother.so"}) {
        { std::ofstream(folder.path() + library) << std::string(4096, 'x'); }
        expectTags(Puppet({"runtimes", folder.path() + library}, LAYOUTS_PROGRAM));
    }
}

TEST(Tags, NamesThatProgramsGiveAreTagsThatBearTheName) {
    EXPECT_EQ(tagOfName(" glibc: pthread stack: 4711"), tags::stack);
    EXPECT_EQ(tagOfName("dalvik-jit-code-cache"), tags::generatedCode);
    EXPECT_EQ(tagOfName(" "), tags::untagged);

    Mapping mapping{
        .end = 4096, .readable = true, .writable = true, .shared = true, .name = "[anon_shmem:cache]"};
    mapping.deviceMinor = 1;
    const BackingObject object = backingOf(mapping, "/nowhere");
    EXPECT_FALSE(object.hasName) << "it would be a mapped file";
    PageStates states;
    states.mappings.resize(1);
    const auto tag = tagsOf("/nowhere", std::span(&mapping, 1), std::span(&object, 1), states).front();
    EXPECT_EQ(QRYRegionTypeDescriptionForTag(tag), "cache");
    EXPECT_EQ(tagOfName("cache"), tag);

    std::set<std::uint32_t> given;
    for (int i = 0; i < 500; ++i) {
        given.insert(tagOfName("name " + std::to_string(i)));
    }
    EXPECT_EQ(*given.begin(), tags::otherNamed) << "there are more names than slots";
    EXPECT_EQ(*given.rbegin(), tags::lastNamed);
    EXPECT_EQ(QRYRegionTypeDescriptionForTag(12), "Memory Tag 12");
}

} // namespace
} // namespace tally::platform
