// ELF files and the segments of images: odd and damaged files, layouts from tables, and a real process.

#include "linux/Puppet.h"
#include "platform/linux/images/ImageSegments.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/DecodeMaps.h"
#include "platform/mach_task.h"
#include "platform/runekit.h"

#include <elf.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>
#include <thread>

namespace tally::platform {
namespace {

const std::string files = ELF_FILES;
const std::string usual = readSystemFile(files + "/usual-64").value_or("");

std::optional<ElfLayout> layoutOf(const std::string& bytes, off_t size = 0) {
    const Descriptor file(memfd_create("elf", MFD_CLOEXEC));
    EXPECT_EQ(write(file.number(), bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    EXPECT_EQ(ftruncate(file.number(), std::max(size, static_cast<off_t>(bytes.size()))), 0);
    return readElfLayout(file);
}

TEST(ElfLayout, ReadsBothClassesAndRefusesWhatNoLoaderTakes) {
    for (const char* name : {"/usual-64", "/usual-32"}) {
        const std::optional<ElfLayout> layout = layoutOf(readSystemFile(files + name).value_or(""));
        ASSERT_TRUE(layout && layout->loads.size() == 4);
        EXPECT_TRUE(layout->loads[1].executable && !layout->loads[0].executable && layout->loads[3].writable);
        EXPECT_EQ(layout->loads[3].firstPage(), 0x6000U);
        EXPECT_EQ(layout->loads[3].endOfFilePages(), 0x9000U);
        EXPECT_EQ(layout->loads[3].endPage(), 0xd000U);
        EXPECT_EQ(layout->relroStart, 0x6000U);
        EXPECT_EQ(layout->relroEnd, 0x7000U);
    }
    const auto changed = [](std::uint64_t Elf64_Phdr::*field, std::uint64_t value) {
        std::string bytes = usual;
        reinterpret_cast<Elf64_Phdr*>(bytes.data() + sizeof(Elf64_Ehdr))[1].*field = value;
        return layoutOf(bytes);
    };
    EXPECT_EQ(changed(&Elf64_Phdr::p_memsz, 0x1000), std::nullopt) << "more in the file than in memory";
    EXPECT_EQ(changed(&Elf64_Phdr::p_memsz, ~0ULL), std::nullopt) << "ends above the last address";
    EXPECT_EQ(changed(&Elf64_Phdr::p_vaddr, 0x2800), std::nullopt) << "not at the same place of a page";
    EXPECT_EQ(changed(&Elf64_Phdr::p_vaddr, ~0ULL << 12), std::nullopt);
    EXPECT_EQ(changed(&Elf64_Phdr::p_offset, ~0ULL << 12), std::nullopt);
    EXPECT_EQ(changed(&Elf64_Phdr::p_vaddr, 0x1000), std::nullopt) << "inside the first";
    EXPECT_TRUE(changed(&Elf64_Phdr::p_vaddr, 0x700000000)) << "in no order, and far apart";

    for (std::size_t length = 0; length < usual.size(); ++length) {
        EXPECT_EQ(layoutOf(usual.substr(0, length)), std::nullopt) << length;
    }
    // As many headers, or sections, as a huge file could hold.
    EXPECT_EQ(layoutOf(readSystemFile(files + "/many-headers-64").value_or(""), 1LL << 40), std::nullopt);
    std::string sections = usual + std::string(sizeof(Elf64_Shdr), '\0');
    auto* header = reinterpret_cast<Elf64_Ehdr*>(sections.data());
    header->e_shoff = usual.size();
    header->e_shnum = 0;
    reinterpret_cast<Elf64_Shdr*>(sections.data() + usual.size())->sh_size = 1ULL << 40;
    EXPECT_TRUE(layoutOf(sections, 1LL << 50)) << "only what is loaded matters";
    EXPECT_EQ(layoutOf("!<arch>\n"), std::nullopt);
    EXPECT_EQ(readElfLayout(Descriptor()), std::nullopt);
}

/// A mapping of a process, with the segment it must be in; "" for none.
struct Mapped {
    std::uint64_t start;
    std::uint64_t end;
    const char* rights;
    std::uint64_t offset;
    const char* name;
    std::string_view segment;
};

void expectSegments(const char* file, const std::vector<Mapped>& process) {
    const ElfLayout layout = layoutOf(readSystemFile(files + file).value_or("")).value_or(ElfLayout());
    std::vector<Mapping> mappings;
    for (const Mapped& m : process) {
        Mapping mapping{.start = m.start, .end = m.end, .fileOffset = m.offset, .name = m.name};
        mapping.inode = m.name[0] == '/' ? static_cast<std::uint64_t>(m.name[1]) : 0;
        mapping.executable = m.rights[2] == 'x';
        mappings.push_back(mapping);
    }
    const auto code = std::ranges::find(mappings, true, &Mapping::executable);
    const auto segments = segmentsOf(layout, biasOf(layout, *code).value_or(0), *code, mappings);
    for (const Mapped& m : process) {
        const auto found = std::ranges::find_if(segments, [&](const RKSegment& segment) {
            return segment.start < m.end && m.start < segment.start + segment.size;
        });
        EXPECT_EQ(found == segments.end() ? "" : found->name, m.segment) << file << ' ' << m.start;
    }
}

TEST(ImageSegments, EveryMappingOfAnImageHasItsName) {
    // Linker data, code, constants, and data of which the first page is relocated.
    expectSegments("/usual-64", {{0x70000000, 0x70001000, "rw-", 0, "", ""},
                                 {0x70001000, 0x70003000, "r--", 0x0, "/a", "__LINKEDIT"},
                                 {0x70003000, 0x70006000, "r-x", 0x2000, "/a", "__TEXT"},
                                 {0x70006000, 0x70007000, "r--", 0x5000, "/a", "__TEXT"},
                                 {0x70007000, 0x70008000, "r--", 0x5000, "/a", "__DATA_CONST"},
                                 {0x70008000, 0x7000a000, "rw-", 0x6000, "/a", "__DATA"},
                                 {0x7000a000, 0x7000e000, "rw-", 0, "", "__BSS"},
                                 {0x7000e000, 0x7000f000, "rw-", 0, "", ""},
                                 {0x70010000, 0x70013000, "r--", 0x0, "/a", ""}}); // mapped again as data
    // Not relocated yet; code replaced by huge pages; memory behind the data merged with a little more.
    expectSegments("/usual-64", {{0x70003000, 0x70004000, "r-x", 0x2000, "/a", "__TEXT"},
                                 {0x70004000, 0x70005000, "r-x", 0, "", "__TEXT"},
                                 {0x70007000, 0x7000a000, "rw-", 0x5000, "/a", "__DATA"},
                                 {0x7000a000, 0x70011000, "rw-", 0, "", "__BSS"}});
    // What lies behind the data is the heap, another file, away from it, or much more than the image's own.
    const std::vector<Mapped> others{{0x7000a000, 0x7000e000, "rw-", 0, "[heap]", ""},
                                     {0x7000a000, 0x7000e000, "rw-", 0x8000, "/b", ""},
                                     {0x7000b000, 0x7000c000, "rw-", 0, "", ""},
                                     {0x7000a000, 0x70020000, "rw-", 0, "", ""}};
    for (const Mapped& other : others) {
        expectSegments("/usual-64", {{0x70003000, 0x70006000, "r-x", 0x2000, "/a", "__TEXT"},
                                     {0x70008000, 0x7000a000, "rw-", 0x6000, "/a", "__DATA"},
                                     other});
    }
    // Other linkers: the relocated part is a segment of its own and constants come first; or code comes
    // first, is not moved, and lies more than 4 GiB below memory that the file has nothing of.
    expectSegments("/relocated-apart-64", {{0x10000, 0x11000, "r--", 0x0, "/a", "__TEXT"},
                                           {0x11000, 0x12000, "---", 0x0, "/a", ""},
                                           {0x12000, 0x13000, "r-x", 0x1000, "/a", "__TEXT"},
                                           {0x14000, 0x15000, "r--", 0x2000, "/a", "__DATA_CONST"},
                                           {0x16000, 0x17000, "rw-", 0x3000, "/a", "__DATA"},
                                           {0x17000, 0x19000, "rw-", 0, "", "__BSS"}});
    expectSegments("/code-first-64", {{0x400000, 0x402000, "r-x", 0x0, "/a", "__TEXT"},
                                      {0x402000, 0x403000, "rw-", 0, "", ""},
                                      {0x100000000, 0x100001000, "r-x", 0x0, "/b", ""},
                                      {0x500000000, 0x500001000, "r--", 0x2000, "/a", "__TEXT"},
                                      {0x600000000, 0x600002000, "rw-", 0, "", "__BSS"}});
}

/// The segments of a process's images, by where they end; `paths` of the images.
std::map<std::uint64_t, std::string> imagesOf(const test::Puppet& puppet, std::set<std::string>* paths) {
    mach_port_t port = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(puppet.pid(), &port), KERN_SUCCESS);
    const PortRight task(port);
    std::map<std::uint64_t, std::string> segments;
    RKForeachSymbolOwner(port, [&](const RKSymbolOwner& owner) {
        paths->insert(owner.path);
        for (const RKSegment& segment : owner.segments) {
            segments[segment.start + segment.size] = segment.name;
        }
    });
    return segments;
}

TEST(Images, NothingThatAProcessMapsOfAnImageIsWithoutItsName) {
    const test::TemporaryFolder folder;
    const std::string path = folder.path() + "/program";
    std::filesystem::copy_file(PUPPET_PROGRAM, path);
    const test::Puppet puppet({"idle"}, path);
    std::filesystem::remove(path);
    std::filesystem::copy_file(files + "/cut-64", path); // something else takes its place

    std::set<std::string> paths;
    const auto segments = imagesOf(puppet, &paths);
    EXPECT_TRUE(paths.contains("[vdso]"));
    EXPECT_EQ(paths.contains(path + " (deleted)"), test::isRoot()); // only root can still open it
    std::set<std::string> seen;
    std::vector<Mapping> mappings;
    decodeMaps(readSystemFile(processFolder(puppet.pid()) + "/maps").value_or(""), &mappings);
    for (const Mapping& mapping : mappings) {
        if (paths.contains(mapping.name)) {
            const auto segment = segments.upper_bound(mapping.start);
            ASSERT_NE(segment, segments.end());
            EXPECT_EQ(mapping.writable, segment->second == "__DATA");
            EXPECT_TRUE(!mapping.executable || segment->second == "__TEXT");
            seen.insert(segment->second);
        }
    }
    EXPECT_EQ(seen, (std::set<std::string>{"__LINKEDIT", "__TEXT", "__DATA_CONST", "__DATA"}));

    const std::string inMemory = "/dev/shm/tally-test-image-" + std::to_string(getpid());
    std::filesystem::copy_file(PUPPET_PROGRAM, inMemory);
    imagesOf(test::Puppet({"idle"}, inMemory), &paths);
    EXPECT_FALSE(paths.contains(inMemory)) << "it is shared memory";
    std::filesystem::remove(inMemory);
}

TEST(ThreadLayoutTable, AFileIsReadByOneOfManyAndAgainWhenItHasChanged) {
    const test::TemporaryFolder folder; // stands for a process's
    const std::string path = folder.path() + "/map_files/0-0";
    std::filesystem::create_directory(folder.path() + "/map_files");
    std::filesystem::copy_file(files + "/usual-64", path);
    const auto read = [&] { return layoutOfFile({.device = 0x4711}, folder.path(), Mapping()); };
    std::vector<std::shared_ptr<const ElfLayout>> layouts(8);
    {
        std::vector<std::jthread> threads;
        for (auto& layout : layouts) {
            threads.emplace_back([&] { layout = read(); });
        }
    }
    const auto first = layouts[0];
    ASSERT_TRUE(first);
    EXPECT_EQ(std::ranges::count(layouts, first), 8);
    std::filesystem::rename(path, path + "-away");
    EXPECT_EQ(read(), first) << "not asked for again in the same gather";
    beginLayouts();
    EXPECT_EQ(read(), nullptr) << "not there now";
    std::filesystem::rename(path + "-away", path);
    EXPECT_EQ(read(), first) << "the same file as before";
    beginLayouts();
    std::filesystem::last_write_time(path, std::filesystem::file_time_type());
    EXPECT_NE(read(), first);

    // Without the right to follow the link to what is mapped: by name, if that is still the same file.
    std::filesystem::create_directory(folder.path() + "/root");
    std::filesystem::rename(path, folder.path() + "/root/image");
    struct stat status {};
    stat((folder.path() + "/root/image").c_str(), &status);
    Mapping mapping{
        .deviceMajor = major(status.st_dev), .deviceMinor = minor(status.st_dev), .name = "/image"};
    EXPECT_EQ(layoutOfFile({.device = 0x4712}, folder.path(), mapping), nullptr);
    mapping.inode = status.st_ino;
    EXPECT_NE(layoutOfFile({.device = 0x4712}, folder.path(), mapping), nullptr);
}

} // namespace
} // namespace tally::platform
