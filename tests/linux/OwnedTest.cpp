// What processes keep alive without mapping it: real descriptors and segments, and a tree that stands in for
// drivers.

#include "linux/Puppet.h"
#include "platform/bsd_process.h"
#include "platform/gather.h"
#include "platform/linux/owned/HeldFiles.h"
#include "platform/linux/owned/OwnedGather.h"
#include "platform/mach_task.h"

#include <gtest/gtest.h>
#include <sys/shm.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>

namespace tally::platform {
namespace {

using test::Puppet;

std::vector<OwnedRecord> ownedBy(const Puppet& puppet) {
    mach_port_t task = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(puppet.pid(), &task), KERN_SUCCESS);
    const PortRight right(task);
    std::size_t length = 0;
    EXPECT_EQ(sysctl_owned_vmobjects(task, {}, &length), 0);
    std::vector<std::byte> reply(length + sizeof(OwnedRecord));
    EXPECT_EQ(sysctl_owned_vmobjects(task, reply, &length), 0);
    std::uint64_t count = 0;
    std::memcpy(&count, reply.data(), sizeof count);
    EXPECT_EQ(length, sizeof count + count * sizeof(OwnedRecord));
    std::vector<OwnedRecord> records(count);
    for (std::size_t i = 0; i < count; ++i) {
        std::memcpy(&records[i], &reply[sizeof count + i * sizeof(OwnedRecord)], sizeof(OwnedRecord));
    }
    return records;
}

TEST(Owned, WhatADescriptorOrASegmentAloneKeepsIsListedToTheByte) {
    const test::HugePagePool pool(1);
    const test::TemporaryFolder folder;
    const std::filesystem::path before = std::filesystem::current_path();
    std::filesystem::current_path(folder.path());
    const Puppet puppet({"hold"}, LAYOUTS_PROGRAM);
    std::filesystem::current_path(before);
    std::vector<OwnedRecord> records = ownedBy(puppet);
    EXPECT_EQ(segmentsCreatedBy(puppet.pid(), 0).size(), 1U);
    EXPECT_TRUE(segmentsCreatedBy(puppet.pid(), 1ULL << 40).empty()) << "another, that has the pid again";
    bool hasMap = false;
    for (const Puppet::Entry& entry : puppet.ledger()) {
        const auto figure = [&](const char* key) {
            return entry.figures.contains(key) ? std::stoull(entry.figures.at(key)) : 0;
        };
        if (entry.name == "bpf") {
            hasMap = true;
            continue; // the kernel alone knows how much it is
        }
        if (entry.name == "segment") {
            shmctl(static_cast<int>(entry.address), IPC_RMID, nullptr);
        }
        const auto record = std::ranges::find_if(records, [&](const OwnedRecord& r) {
            return r.residentSize == entry.size && r.virtualSize == figure("size") &&
                   r.wiredSize == figure("wired") && r.compressedSize + r.reusableSize == 0 && r.flags == 48;
        });
        EXPECT_EQ(record != records.end(), entry.figures.at("listed") == "yes") << entry.name;
        if (record != records.end()) {
            records.erase(record);
        }
    }
    EXPECT_EQ(records.size(), hasMap ? 1U : 0U);
    if (pool.granted() == 0) {
        GTEST_SKIP() << "this machine grants no huge pages: no memfd of huge pages was held";
    }
}

/// A file on a tmpfs, which its name alone does not delete, until it is deleted or the holder goes away.
struct SharedFile {
    std::string path = "/dev/shm/tally-test-owned-" + std::to_string(getpid()) + " (deleted)";
    explicit SharedFile(std::size_t pages) { std::ofstream(path) << std::string(pages * 4096, 'x'); }
    ~SharedFile() { unlink(path.c_str()); }
};

TEST(Owned, OfSeveralHoldersTheFirstThatAsksListsAnObjectInAGather) {
    const SharedFile file(6);
    const Puppet one({"open", file.path}, LAYOUTS_PROGRAM);
    const Puppet two({"open", file.path}, LAYOUTS_PROGRAM);
    const Puppet mapper({"fill", file.path, "6"});
    EXPECT_TRUE(ownedBy(one).empty()) << "the file has a path as yet, which keeps it";
    unlink(file.path.c_str());
    EXPECT_EQ(ownedBy(one).size() + ownedBy(two).size(), 2U) << "no gather: everyone holds it";
    for (const bool turned : {false, true}) {
        const GatherScope gather;
        EXPECT_EQ(ownedBy(turned ? two : one).size(), 1U);
        EXPECT_EQ(ownedBy(turned ? one : two).size(), 0U);
        EXPECT_EQ(ownedBy(turned ? two : one).size(), 1U) << "asked again";
        EXPECT_TRUE(ownedBy(mapper).empty());
    }
}

TEST(Owned, TheHolderPaysForWhatOthersMapAndASearchFindsThem) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "only root can search all processes";
    }
    const SharedFile file(16);
    const Puppet holder({"open", file.path}, LAYOUTS_PROGRAM);
    const Puppet mapper({"fill", file.path, "10"});
    unlink(file.path.c_str());
    const std::string held = std::to_string(holder.pid());
    const std::string mapped = std::to_string(mapper.pid());
    /// The dirty bytes of the file in the section that begins with `title`.
    const auto bytesIn = [&](const std::string& title, std::vector<std::string> arguments) {
        arguments.insert(arguments.begin(), {TALLY_PROGRAM, "-w", "-v", "-f", "bytes", "--pid", held});
        const std::string report = test::run(arguments).output;
        const std::size_t section = report.find(title);
        EXPECT_NE(section, std::string::npos) << report;
        const std::size_t row = report.find("    mapped file " + file.path + " (deleted)\n", section);
        EXPECT_NE(row, std::string::npos) << report;
        return std::stoll(report.substr(report.rfind('\n', row) + 1));
    };
    EXPECT_EQ(bytesIn("Shared with puppet [" + mapped + "]", {"--pid", mapped}), 16 * 4096);
    EXPECT_EQ(bytesIn("Shared with layouts [" + held + "]", {"--pid", mapped}), 0);
    EXPECT_EQ(bytesIn("Summary Tally", {"--pid", mapped}), 16 * 4096);
    EXPECT_EQ(bytesIn("Shared with puppet [" + mapped + "]", {"--unmapped"}), 16 * 4096);
}

TEST(Owned, ADriversWordsAreTakenByTheLinksOfItsDescriptors) {
    const test::TemporaryFolder folder;
    const auto fd = std::filesystem::path(folder.path()) / "fd";
    const auto fdinfo = std::filesystem::path(folder.path()) / "fdinfo";
    std::filesystem::create_directory(fd);
    std::filesystem::create_directory(fdinfo);
    struct Case {
        std::string link;
        const char* info;
        std::vector<std::uint64_t> record; // flags, virtual, resident, wired, reusable size; empty: none
    };
    const std::string card = "/dev/dri/renderD128";
    const Case cases[] = {
        {"/dmabuf:",
         "pos:\t0\nino:\t91\nsize:\t65536\nexp_name:\tsystem\nname:\ta: b\n",
         {56, 65536, 65536, 0, 0}},
        {"/dmabuf:", "ino:\t92\nsize:\t4096\nexp_name:\tudmabuf\n", {}}, // a memfd has these pages
        {"/dmabuf:", "size:\t4096\n", {}},                               // no telling it from others
        {"/dmabuf:", "ino:\t93\nsize:\tmany\n", {}},
        {"/dmabuf:", "", {}},
        {card,
         "drm-driver:\tx\ndrm-client-id:\t7\ndrm-total-system0:\t9 MiB\ndrm-shared-system0:\t2048 KiB\n"
         "drm-resident-system0:\t5 MiB\ndrm-purgeable-system0:\t4096\ndrm-engine-render:\t123 ns\n"
         "drm-total-vram0:\t64 MiB\ndrm-resident-vram0:\t64 MiB\n",
         {56, 7 << 20, 3 << 20, 0, 4096}},
        {card,
         "drm-client-id: 8\ndrm-memory-gtt: 100 KiB\ndrm-memory-cpu: 4 KiB\n",
         {56, 106496, 106496, 0, 0}},
        {card, "drm-resident-memory: 1 MiB\n", {}}, // of which client?
        {card, "drm-client-id: 9\ndrm-resident-memory: 1 KiB\ndrm-shared-memory: 2 KiB\n", {}},
        {card, "drm-client-id: 9\ndrm-resident-memory: 99999999999999999 GiB\n", {}},
        {"anon_inode:bpf-map",
         "max_entries:\t2\nmemlock:\t36864\nmap_id:\t3\n",
         {49, 36864, 36864, 36864, 0}},
        {"anon_inode:bpf-map", "memlock:\t36864\n", {}},
        {"anon_inode:[eventfd]", "memlock:\t36864\nmap_id:\t4\n", {}},
        {"/" + std::string(4000, 'x') + " (deleted)", "ino:\t91\nsize:\t65536\n", {}},
    };
    for (const Case& c : cases) {
        std::filesystem::create_symlink(c.link, fd / "3");
        std::ofstream(fdinfo / "3") << c.info;
        std::vector<std::uint64_t> record;
        EXPECT_TRUE(forEachHeldObject(folder.path(), [&](const OwnedRecord& r) {
            record = {r.flags, r.virtualSize, r.residentSize, r.wiredSize, r.reusableSize};
        }));
        EXPECT_EQ(record, c.record) << c.info;
        std::filesystem::remove(fd / "3");
    }
    EXPECT_FALSE(forEachHeldObject(folder.path() + "/none", [](const OwnedRecord&) {}));
}

TEST(Owned, SegmentsAreReadFromTheKernelsTable) {
    const auto segments = decodeSysVSegments(
        "       key      shmid perms                  size  cpid  lpid nattch   uid   gid  cuid  cgid\n"
        "        -1         32  1600               6291456  7786 1 0 0 0 0 0 1 2 1790000000  6287360 4096\n"
        "         0         33  1600                  4096     1 1 0 0 0 0 0 1 2 3           4096\n");
    ASSERT_EQ(segments.size(), 1U);
    EXPECT_TRUE(segments[0].id == 32 && segments[0].creator == 7786 && segments[0].changed == 1790000000);
    EXPECT_TRUE(segments[0].size == 6291456 && segments[0].resident == 6287360 &&
                segments[0].swapped == 4096);
}

} // namespace
} // namespace tally::platform
