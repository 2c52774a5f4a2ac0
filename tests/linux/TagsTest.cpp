// What memory without a name is taken for, on programs that lay it out in these ways, and what is left alone.

#include "platform/linux/tags/Tags.h"
#include "linux/Puppet.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/tags/TagTable.h"
#include "platform/linux/tags/ThreadStacks.h"
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
    EXPECT_EQ(tagOfName(" glibc: malloc arena"), tags::mallocArena);
    EXPECT_EQ(tagOfName(" glibc: pthread stack: 4711"), tags::stack);
    EXPECT_EQ(tagOfName("dalvik-jit-code-cache"), tags::generatedCode);
    EXPECT_EQ(tagOfName(" "), tags::untagged);

    const Mapping nameless{.end = 4096, .readable = true, .writable = true, .name = "[anon:]"};
    std::vector<Mapping> mappings{nameless, nameless, nameless};
    mappings[1].name = "[anon:page cache]";
    mappings[2].name = "[anon_shmem:page cache]";
    mappings[2].shared = true;
    mappings[2].deviceMinor = 1;
    std::vector<BackingObject> objects;
    for (const Mapping& mapping : mappings) {
        objects.push_back(backingOf(mapping, "/nowhere"));
    }
    PageStates states;
    states.mappings.resize(mappings.size());
    const std::vector<std::uint32_t> tags = tagsOf("/nowhere", mappings, objects, states);
    EXPECT_EQ(tags[0], tags::untagged);
    EXPECT_EQ(QRYRegionTypeDescriptionForTag(tags[1]), "page cache");
    EXPECT_EQ(tags[2], tags[1]);
    EXPECT_FALSE(objects[2].hasName) << "it would be a mapped file";

    std::set<std::uint32_t> given;
    for (int i = 0; i < 500; ++i) {
        given.insert(tagOfName("name " + std::to_string(i)));
    }
    EXPECT_EQ(*given.begin(), tags::otherNamed) << "there are more names than slots";
    EXPECT_EQ(*given.rbegin(), tags::lastNamed);
    EXPECT_EQ(QRYRegionTypeDescriptionForTag(tagOfName("name 0")), "name 0");
    EXPECT_EQ(QRYRegionTypeDescriptionForTag(12), "Memory Tag 12");
}

TEST(Tags, AThreadThatRunsTellsNoStackPointer) {
    EXPECT_EQ(decodeStackPointer("running\n"), std::nullopt);
    EXPECT_EQ(decodeStackPointer("202 0x7f1 0x189 0x0 0x0 0x0 0x0 0x7ffd10 0x7f20\n"), 0x7ffd10U);
    EXPECT_EQ(decodeStackPointer("-1 0x7ffd20 0x7f30"), 0x7ffd20U);
    EXPECT_EQ(decodeStackPointer("-1 x 0x7f30"), std::nullopt);
}

} // namespace
} // namespace tally::platform
