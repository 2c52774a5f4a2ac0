// The walk of real processes, held against what the kernel's own smaps says of them.

#include "linux/Puppet.h"
#include "platform/bsd_process.h"
#include "platform/gather.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/pages/DecodeMaps.h"
#include "platform/linux/pages/PageSource.h"
#include "platform/linux/pages/SmapsOfProcess.h"
#include "platform/mach_task.h"
#include "platform/mach_vm.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <fstream>
#include <vector>

namespace tally::platform {
namespace {

using test::Puppet;

struct Region {
    std::uint64_t start = 0;
    std::uint64_t size = 0;
    vm_region_submap_info_64 info;
    std::string file;

    std::uint64_t end() const { return start + size; }
};

struct WholeWalk {
    std::vector<Region> regions;
    kern_return_t status = KERN_SUCCESS; // of the query behind the last one
};

WholeWalk walk(mach_port_t task, int pid) {
    WholeWalk whole;
    for (std::uint64_t address = 0, size = 0;; address += size) {
        Region region;
        std::uint32_t depth = 0xFFFFFFFF;
        std::uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        whole.status = mach_vm_region_recurse(task, &address, &size, &depth, &region.info, &count);
        if (whole.status != KERN_SUCCESS) {
            return whole;
        }
        region.start = address;
        region.size = size;
        std::vector<char> name(1024);
        const int length = proc_regionfilename(pid, address, name);
        region.file.assign(name.data(), length > 0 ? static_cast<std::size_t>(length) : 0);
        whole.regions.push_back(region);
    }
}

/// Sums over the regions of one mapping, in bytes.
struct Sums {
    std::uint64_t resident = 0;
    std::uint64_t dirty = 0;
    std::uint64_t own = 0; // private memory of the task
    std::uint64_t swapped = 0;
    std::uint64_t reusable = 0;
    std::uint64_t wired = 0;
    bool complete = false; // the regions cover the mapping side by side
};

Sums sumsOf(const WholeWalk& whole, std::uint64_t start, std::uint64_t end) {
    Sums sums;
    std::uint64_t reached = start;
    for (const Region& region : whole.regions) {
        if (region.start < start || region.start >= end) {
            continue;
        }
        EXPECT_EQ(region.start, reached);
        reached = region.end();
        const vm_region_submap_info_64& info = region.info;
        sums.resident += info.pages_resident * vm_kernel_page_size();
        sums.dirty += info.pages_dirtied * vm_kernel_page_size();
        sums.own += info.share_mode == SM_PRIVATE ? info.pages_resident * vm_kernel_page_size() : 0;
        sums.swapped += info.pages_swapped_out * vm_kernel_page_size();
        sums.reusable += info.pages_reusable * vm_kernel_page_size();
        sums.wired += info.user_wired_count != 0 ? region.size : 0;
        EXPECT_LE((info.pages_resident + info.pages_swapped_out) * vm_kernel_page_size(), region.size);
        EXPECT_LE(info.pages_dirtied + info.pages_reusable, info.pages_resident);
        const bool isKernels = info.user_tag == 104;
        EXPECT_EQ(info.object_id_full == 0, isKernels || info.pages_resident + info.pages_swapped_out == 0);
        EXPECT_EQ(info.share_mode == SM_EMPTY, info.object_id_full == 0);
    }
    sums.complete = reached == end;
    return sums;
}

class AccountingSwitch {
  public:
    explicit AccountingSwitch(int value) { sysctlbyname_write("vm.self_region_tally", value); }
    ~AccountingSwitch() { sysctlbyname_write("vm.self_region_tally", 0); }
};

/// A right to the puppet's task.
PortRight taskOf(const Puppet& puppet) {
    mach_port_t task = MACH_PORT_NULL;
    EXPECT_EQ(task_read_for_pid(puppet.pid(), &task), KERN_SUCCESS);
    return PortRight(task);
}

void expectFigure(const Puppet::Entry& entry, const char* key, std::uint64_t measured) {
    const auto figure = entry.figures.find(key);
    if (figure != entry.figures.end() && figure->second != "any") {
        EXPECT_EQ(std::to_string(measured), figure->second) << entry.name << " " << key;
    }
}

TEST(Walk, ShowsEveryKindOfMemoryAsSmapsAndTheProcessItselfDo) {
    const AccountingSwitch on(1);
    const test::HugePagePool pool(4);
    const Puppet puppet({"zoo"});
    const PortRight task = taskOf(puppet);
    const WholeWalk whole = walk(task.name(), puppet.pid());
    EXPECT_EQ(whole.status, KERN_INVALID_ADDRESS);

    std::uint64_t memfdResident = 0;
    std::uint64_t lazyFree = 0;
    std::vector<Mapping> mappings;
    decodeMaps(readSystemFile(processFolder(puppet.pid()) + "/maps").value_or(""), &mappings);
    SmapsOfProcess smaps(processFolder(puppet.pid()));
    for (const Mapping& mapping : mappings) {
        SCOPED_TRACE(mapping.name);
        ASSERT_NE(smaps.entryFor(mapping), nullptr);
        const SmapsEntry entry = *smaps.entryFor(mapping);
        const Sums sums = sumsOf(whole, mapping.start, mapping.end);
        EXPECT_TRUE(sums.complete);
        if (mapping.name == "/memfd:zoo (deleted)") {
            memfdResident += sums.resident; // mapped twice
            continue;
        }
        EXPECT_EQ(sums.resident, entry.resident + entry.hugetlb);
        EXPECT_EQ(sums.swapped, entry.swapped);
        EXPECT_EQ(sums.reusable, entry.lazyFree);
        if (entry.hugetlb == 0) {
            EXPECT_EQ(sums.own, entry.anonymous);
        }
        lazyFree += entry.lazyFree;
    }
    EXPECT_EQ(memfdResident, 24 * vm_kernel_page_size()); // pages 0 to 23 of the object, once each
    EXPECT_GT(lazyFree, 8U << 20);

    for (const Puppet::Entry& entry : puppet.ledger()) {
        const Sums sums = sumsOf(whole, entry.address, entry.address + entry.size);
        expectFigure(entry, "dirty", sums.dirty);
        expectFigure(entry, "clean", sums.resident - sums.dirty - sums.reusable);
        if (entry.name == "shared-anonymous") { // pages 2 to 8 were written
            std::vector<std::int32_t> words(24);
            std::uint64_t count = words.size();
            EXPECT_EQ(mach_vm_page_range_query(task.name(), entry.address, entry.size, words, &count),
                      KERN_SUCCESS);
            for (std::size_t page = 0; page < words.size(); ++page) {
                EXPECT_EQ(words[page] != 0, page >= 2 && page < 9) << page;
            }
        }
        if (entry.figures.contains("wired")) {
            EXPECT_EQ(sums.wired, sums.resident) << entry.name;
        } else if (!entry.figures.contains("shared")) { // shared memory is wired page by page
            EXPECT_EQ(sums.wired, 0U) << entry.name;
        }
    }
    if (pool.granted() == 0) {
        GTEST_SKIP() << "this machine grants no huge pages: hugetlb memory was not compared";
    }
}

TEST(Walk, TheObjectViewCountsWhatTheObjectHoldsAndTheChargedViewWhatWasTouched) {
    if (!test::isRoot()) {
        GTEST_SKIP() << "the page cache is asked for root only";
    }
    const test::TemporaryFolder folder;
    const std::string path = "/dev/shm/tally-test-" + std::to_string(getpid());
    const int file = open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
    ASSERT_GE(file, 0);
    const std::string bytes(10 * vm_kernel_page_size(), 'x');
    ASSERT_EQ(::write(file, bytes.data(), bytes.size()), static_cast<ssize_t>(bytes.size()));
    ASSERT_EQ(ftruncate(file, 32 * 4096), 0);
    const Puppet filler({"fill", path, "4"}); // has touched 4 of the 10 pages that are there
    const Puppet other({"fill", path, "2"});
    unlink(path.c_str());
    close(file);

    std::vector<std::uint64_t> ids;
    for (const int view : {1, 0}) {
        const AccountingSwitch value(view);
        const PortRight task = taskOf(filler);
        const Puppet::Entry& entry = filler.ledger().front();
        const WholeWalk whole = walk(task.name(), filler.pid());
        const Sums sums = sumsOf(whole, entry.address, entry.address + entry.size);
        EXPECT_TRUE(sums.complete);
        EXPECT_EQ(sums.dirty, (view == 1 ? 4 : 10) * vm_kernel_page_size());
        for (const Region& region : whole.regions) {
            if (region.start == entry.address) {
                EXPECT_EQ(region.size, (view == 1 ? 32 : 10) * vm_kernel_page_size());
                EXPECT_EQ(region.info.external_pager, 1);
                EXPECT_EQ(region.file, path + " (deleted)");
                ids.push_back(region.info.object_id_full);
            }
        }
    }
    const AccountingSwitch on(1);
    const PortRight task = taskOf(other);
    for (const Region& region : walk(task.name(), other.pid()).regions) {
        if (region.start == other.ledger().front().address) {
            ids.push_back(region.info.object_id_full);
        }
    }
    ASSERT_EQ(ids.size(), 3U);
    EXPECT_EQ(ids[0], ids[1]);
    EXPECT_EQ(ids[0], ids[2]); // the other process maps the same object
}

/// Whose pages are another file system's, and whose nobody writes back.
TEST(Walk, WhatIsWrittenIsDirtyOnEveryFileSystem) {
    const test::TemporaryFolder folder;
    for (const char* name : {"/lower", "/upper", "/work", "/mount"}) {
        ASSERT_EQ(mkdir((folder.path() + name).c_str(), 0700), 0);
    }
    const std::string layers = "lowerdir=" + folder.path() + "/lower,upperdir=" + folder.path() +
                               "/upper,workdir=" + folder.path() + "/work";
    const std::string mountPoint = folder.path() + "/mount";
    for (const auto& [type, options] : {std::pair("overlay", layers), std::pair("ramfs", std::string())}) {
        if (mount(type, mountPoint.c_str(), type, 0, options.c_str()) != 0) {
            GTEST_SKIP() << "nothing can be mounted here";
        }
        std::ofstream(mountPoint + "/file").close();
        EXPECT_EQ(truncate((mountPoint + "/file").c_str(), 32 * 4096), 0);
        for (const int view : {1, 0}) {
            SCOPED_TRACE(std::string(type) + (view == 1 ? ", charged" : ", object"));
            const AccountingSwitch value(view);
            const Puppet filler({"fill", mountPoint + "/file", "4"});
            const Puppet::Entry& entry = filler.ledger().front();
            const PortRight task = taskOf(filler);
            const WholeWalk whole = walk(task.name(), filler.pid());
            EXPECT_EQ(sumsOf(whole, entry.address, entry.address + entry.size).dirty,
                      4 * vm_kernel_page_size());
        }
        EXPECT_EQ(umount2(mountPoint.c_str(), MNT_DETACH), 0);
    }
}

TEST(Walk, OneThatBeganGoesOnWhenItsProcessHasEnded) {
    Puppet puppet({"zoo"});
    const PortRight task = taskOf(puppet);
    std::uint64_t address = 0;
    std::uint64_t size = 0;
    vm_region_basic_info_64 basic;
    ASSERT_EQ(mach_vm_region(task.name(), &address, &size, &basic), KERN_SUCCESS);
    puppet.end(true);
    EXPECT_EQ(walk(task.name(), puppet.pid()).status, KERN_INVALID_ADDRESS);
    const WholeWalk dead = walk(task.name(), puppet.pid());
    EXPECT_EQ(dead.status, KERN_INVALID_ARGUMENT);
    EXPECT_TRUE(dead.regions.empty());
}

TEST(Walk, PagesOfAProcessThatEndsMeanwhileAreNotTakenForThere) {
    Puppet puppet({"big", "8"});
    ProcessMemoryFiles files;
    std::vector<Mapping> mappings;
    const std::uint64_t started = readProcessStat(puppet.pid())->startTicks;
    ASSERT_EQ(files.open(puppet.pid(), started, &mappings), KERN_SUCCESS);
    puppet.end();
    SmapsOfProcess smaps(files.folder);
    PageSource source(files, mappings, smaps, PageDetail::counts);
    PageStates states;
    EXPECT_EQ(readPageStates(source, smaps, mappings, &states), KERN_INVALID_ARGUMENT);
    EXPECT_TRUE(states.mappings.empty());
}

TEST(Walk, AProcessWhoseFirstThreadHasEndedIsReadThroughAnother) {
    const AccountingSwitch on(1);
    const Puppet puppet({"leaderless"});
    const PortRight task = taskOf(puppet);
    const WholeWalk whole = walk(task.name(), puppet.pid());
    EXPECT_EQ(whole.status, KERN_INVALID_ADDRESS);
    const Puppet::Entry& entry = puppet.ledger().front();
    EXPECT_EQ(sumsOf(whole, entry.address, entry.address + entry.size).dirty, 32 * vm_kernel_page_size());
    proc_bsdshortinfo info;
    ASSERT_EQ(proc_pidinfo(puppet.pid(), &info), 64);
    EXPECT_EQ(info.pbsi_status, SRUN);
    rusage_info_v5 usage;
    ASSERT_EQ(proc_pid_rusage(puppet.pid(), &usage), 0);
    EXPECT_GT(usage.ri_phys_tally, 32 * vm_kernel_page_size());
}

TEST(Walk, AnAddressSpaceThatChangesMeanwhileIsReadInOrderAndToItsEnd) {
    const AccountingSwitch on(1);
    const Puppet puppet({"churn"});
    const PortRight task = taskOf(puppet);
    for (int round = 0; round < 200; ++round) {
        const WholeWalk whole = walk(task.name(), puppet.pid());
        ASSERT_EQ(whole.status, KERN_INVALID_ADDRESS);
        std::uint64_t reached = 0;
        for (const Region& region : whole.regions) {
            ASSERT_GE(region.start, reached);
            ASSERT_LE((region.info.pages_resident + region.info.pages_swapped_out) * vm_kernel_page_size(),
                      region.size);
            reached = region.end();
        }
    }
}

TEST(Walk, TenThousandMappingsAndMoreAreReadAsFewAre) {
    const AccountingSwitch on(1);
    for (const char* count : {"3000", "30000"}) {
        const Puppet puppet({"maps", count});
        const PortRight task = taskOf(puppet);
        const Puppet::Entry& entry = puppet.ledger().front();
        const Sums sums = sumsOf(walk(task.name(), puppet.pid()), entry.address, entry.address + entry.size);
        EXPECT_TRUE(sums.complete);
        expectFigure(entry, "dirty", sums.dirty);
    }
}

TEST(Ledger, TellsResidentAnonymousMemoryAndTheMostThereEverWas) {
    const Puppet puppet({"big", "8"});
    rusage_info_v5 usage;
    ASSERT_EQ(proc_pid_rusage(puppet.pid(), &usage), 0);
    EXPECT_GE(usage.ri_resident_anonymous, 8U << 20);
    EXPECT_LT(usage.ri_resident_anonymous, usage.ri_phys_tally) << "without its page tables";
    EXPECT_GT(usage.ri_lifetime_max_phys_tally, usage.ri_phys_tally) << "pages of files were resident, too";
}

} // namespace
} // namespace tally::platform
