// What processes keep alive without mapping it: real descriptors and segments, and a tree that stands in for
// drivers.

#include "linux/Puppet.h"
#include "platform/bsd_process.h"
#include "platform/gather.h"
#include "platform/linux/io/Descriptor.h"
#include "platform/linux/owned/HeldFiles.h"
#include "platform/linux/owned/OwnedGather.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/mach_task.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>

namespace tally::platform {
namespace {

using test::Puppet;

std::vector<owned_vmobject> ownedBy(std::int32_t pid) {
    mach_port_t task = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(pid, &task), KERN_SUCCESS);
    const PortRight right(task);
    const auto owned = sysctl_owned_vmobjects(task);
    EXPECT_TRUE(owned);
    return owned.value_or(std::vector<owned_vmobject>());
}

/// A file of `size` bytes of which the first `pages` are there.
Descriptor filled(int number, off_t size, std::size_t pages) {
    const std::string bytes(pages * basePage, 'x');
    EXPECT_EQ(ftruncate(number, size), 0);
    EXPECT_EQ(pwrite(number, bytes.data(), bytes.size(), 0), static_cast<ssize_t>(bytes.size()));
    return Descriptor(number);
}

int deletedFile(std::string path) {
    const int file = mkostemp(path.data(), O_CLOEXEC);
    unlink(path.c_str());
    return file;
}

TEST(Owned, WhatADescriptorOrASegmentAloneKeepsIsListedToTheByte) {
    const test::TemporaryFolder folder;
    ASSERT_EQ(mkfifo((folder.path() + "/fifo").c_str(), 0600), 0);
    const Descriptor fifo(open((folder.path() + "/fifo").c_str(), O_RDWR | O_CLOEXEC));
    const Descriptor memfd = filled(memfd_create("held", MFD_CLOEXEC), 0x10000, 12);
    const Descriptor again(fcntl(memfd.number(), F_DUPFD_CLOEXEC, 0));
    const Descriptor sparse = filled(memfd_create("sparse", MFD_CLOEXEC), 1LL << 40, 1);
    const Descriptor empty = filled(memfd_create("empty", MFD_CLOEXEC), 0x8000, 0);
    const Descriptor deleted = filled(deletedFile("/dev/shm/tally-test-XXXXXX"), 9 * 0x1000, 9);
    const Descriptor onDisk = filled(deletedFile("/var/tmp/tally-test-XXXXXX"), 11 * 0x1000, 11);
    const Descriptor mapped = filled(memfd_create("mapped", MFD_CLOEXEC), 0x8000, 5);
    mmap(nullptr, basePage, PROT_READ, MAP_SHARED, mapped.number(), 0);
    const int segment = shmget(IPC_PRIVATE, 20 * 0x1000, 0600 | IPC_CREAT);
    auto* const memory = static_cast<char*>(shmat(segment, nullptr, 0));
    memory[0] = memory[5 * 0x1000] = 1;
    shmdt(memory);
    if (const int other = fork(); other == 0) { // attaches it last, but has not made it
        _exit(shmat(segment, nullptr, 0) == nullptr ? 1 : 0);
    } else {
        waitpid(other, nullptr, 0);
    }
    const int attached = shmget(IPC_PRIVATE, 7 * 0x1000, 0600 | IPC_CREAT);
    static_cast<char*>(shmat(attached, nullptr, 0))[0] = 1;
    shmctl(attached, IPC_RMID, nullptr);
    using Sizes = std::multiset<std::array<std::uint64_t, 3>>; // virtual, resident, wired
    Sizes expected{{0x10000, 0xc000, 0}, {1ULL << 40, 0x1000, 0}, {0x9000, 0x9000, 0}, {0x14000, 0x2000, 0}};
    const test::HugePagePool pool(1);
    const Descriptor huge(memfd_create("huge", MFD_CLOEXEC | MFD_HUGETLB));
    if (fallocate(huge.number(), 0, 0, 2 << 20) == 0) {
        expected.insert({2 << 20, 2 << 20, 2 << 20});
    }
    Sizes found;
    for (const owned_vmobject& r : ownedBy(getpid())) {
        found.insert({r.virtualSize, r.residentSize, r.wiredSize});
        EXPECT_EQ(r.purgeable, VM_PURGABLE_DENY);
        EXPECT_EQ(r.reusableSize + r.compressedSize, 0U);
    }
    EXPECT_EQ(segmentsCreatedBy(getpid(), 0).size(), 2U);
    EXPECT_TRUE(segmentsCreatedBy(getpid(), 1ULL << 40).empty()) << "a process that has the pid again";
    shmctl(segment, IPC_RMID, nullptr);
    for (const auto& sizes : expected) {
        EXPECT_EQ(found.count(sizes), 1U) << sizes[0];
    }
    EXPECT_EQ(found.count({0x8000, 0x5000, 0}) + found.count({0x8000, 0, 0}), 0U) << "mapped, empty";
    EXPECT_EQ(found.count({0xb000, 0xb000, 0}) + found.count({0x7000, 0x1000, 0}), 0U) << "on disk, attached";
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
    EXPECT_TRUE(ownedBy(one.pid()).empty()) << "the file has a path as yet, which keeps it";
    unlink(file.path.c_str());
    EXPECT_EQ(ownedBy(one.pid()).size() + ownedBy(two.pid()).size(), 2U) << "no gather: everyone holds it";
    for (const bool turned : {false, true}) {
        const GatherScope gather;
        EXPECT_EQ(ownedBy((turned ? two : one).pid()).size(), 1U);
        EXPECT_EQ(ownedBy((turned ? one : two).pid()).size(), 0U);
        EXPECT_EQ(ownedBy((turned ? two : one).pid()).size(), 1U) << "asked again";
        EXPECT_TRUE(ownedBy(mapper.pid()).empty());
    }
}

TEST(Owned, ADriversWordsAreTakenByTheLinksOfItsDescriptors) {
    const test::TemporaryFolder folder;
    std::filesystem::create_directory(folder.path() + "/fd");
    std::filesystem::create_directory(folder.path() + "/fdinfo");
    const std::string card = "/dev/dri/renderD128";
    struct Case {
        std::string link;
        const char* info;
        std::vector<std::uint64_t>
            record; // 1 for no tally, ledger tag, virtual, resident, wired, reusable size; empty: none
    };
    const Case cases[] = {
        {"/dmabuf:",
         "pos:\t0\nino:\t91\nsize:\t65536\nexp_name:\tsystem\nname:\ta: b\n",
         {0, 4, 65536, 65536, 0, 0}},
        {"/dmabuf:", "ino:\t92\nsize:\t4096\nexp_name:\tudmabuf\n", {}}, // a memfd has these pages
        {"/dmabuf:", "size:\t4096\n", {}},                               // no telling it from others
        {"/dmabuf:", "ino:\t93\nsize:\tmany\n", {}},
        {card,
         "drm-client-id:\t7\ndrm-total-system0:\t9 MiB\ndrm-shared-system0:\t2048 KiB\ndrm-engine-x:\t1 ns\n"
         "drm-resident-system0:\t5 MiB\ndrm-purgeable-system0:\t4096\ndrm-resident-vram0:\t64 MiB\n",
         {0, 4, 7 << 20, 3 << 20, 0, 4096}},
        {card,
         "drm-client-id: 8\ndrm-memory-gtt: 100 KiB\ndrm-memory-cpu: 4 KiB\n",
         {0, 4, 106496, 106496, 0, 0}},
        {card, "drm-resident-memory: 1 MiB\n", {}}, // of which client?
        {card, "drm-client-id: 9\ndrm-resident-memory: 1 KiB\ndrm-shared-memory: 2 KiB\n", {}},
        {card, "drm-client-id: 9\ndrm-resident-memory: 99999999999999999 GiB\n", {}},
        {"anon_inode:bpf-map",
         "max_entries:\t2\nmemlock:\t36864\nmap_id:\t3\n",
         {1, 0, 36864, 36864, 36864, 0}},
        {"anon_inode:[eventfd]", "memlock:\t36864\nmap_id:\t4\n", {}},
        {"/" + std::string(4000, 'x') + " (deleted)", "ino:\t91\nsize:\t65536\n", {}},
    };
    for (const Case& c : cases) {
        std::filesystem::create_symlink(c.link, folder.path() + "/fd/3");
        std::ofstream(folder.path() + "/fdinfo/3") << c.info;
        std::vector<std::uint64_t> record;
        EXPECT_TRUE(forEachHeldObject(folder.path(), [&](const owned_vmobject& r) {
            record = {r.noTally, r.ledgerTag, r.virtualSize, r.residentSize, r.wiredSize, r.reusableSize};
        }));
        EXPECT_EQ(record, c.record) << c.info;
        std::filesystem::remove(folder.path() + "/fd/3");
    }
    EXPECT_FALSE(forEachHeldObject(folder.path() + "/none", [](const owned_vmobject&) {}));
}

} // namespace
} // namespace tally::platform
