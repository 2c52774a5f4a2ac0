// The kernel's own accounts of its memory: odd texts, whole trees, and this machine's.

#include "linux/Puppet.h"
#include "platform/bsd_process.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/kernel/KernelTexts.h"
#include "platform/mach_kernel_memory.h"
#include "platform/mach_vm.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <filesystem>
#include <fstream>

namespace tally::platform {
namespace {

using Sizes = std::map<std::string, std::uint64_t, std::less<>>;

TEST(KernelTexts, TakeWhatTheyKnowAndPassOverTheRest) {
    const Meminfo meminfo(
        "MemTotal:  24684096 kB\nActive(anon):   8 kB\nHugePages_Free:    3\nX\nBad: x kB\n");
    EXPECT_EQ(meminfo["MemTotal"], 24684096ULL * 1024);
    EXPECT_EQ(meminfo["Active(anon)"], 8192U);
    EXPECT_EQ(meminfo["HugePages_Free"], 3U) << "a count";
    EXPECT_EQ(meminfo["Bad"] + meminfo["Absent"], 0U);

    constexpr std::uint64_t page = 16384; // of another machine
    const auto caches = decodeSlabinfo("slabinfo - version: 2.1\n"
                                       "# name <active_objs> : tunables <limit> : slabdata <active_slabs>\n"
                                       "dentry 7 21 192 21 1 : tunables 0 0 0 : slabdata 1 2 0\n"
                                       "two words 7 21 192 21 1 : tunables 0 0 0 : slabdata 1 2 0\n"
                                       "short 7 21 : tunables 0 0 0 : slabdata 1 2 0\n"
                                       "cut 7 21 192 21 1 : tunables 0 0 0 : slabdata 1",
                                       page);
    ASSERT_EQ(caches.size(), 1U);
    EXPECT_EQ(caches[0].name, "dentry");
    EXPECT_EQ(caches[0].elementsInUse * caches[0].elementSize, 7U * 192);
    EXPECT_EQ(caches[0].size, 2 * page);

    const Sizes callers{{"kernel_clone", 6 * page}, {"f [mod]", page}, {"unknown caller", 2 * page}};
    EXPECT_EQ(decodeVmallocinfo("0x1-0x2   20480 kernel_clone+0x94/0x3e0 pages=4 vmalloc N0=4\n"
                                "0x2-0x3   12288 kernel_clone+0x10/0x3e0 pages=2 vmalloc\n"
                                "0x3-0x4    8192 f+0x1/0x2 [mod] pages=1 vmalloc N0=1\n"
                                "0x4-0x5   12288 pages=2 vmalloc\n"
                                "0x5-0x6    8192 unpurged vm_area\n"
                                "0x6-0x7    8192 ioremap_it+0x1/0x2 phys=0x1000 ioremap\n"
                                "0x7-0x8",
                                page),
              callers);

    const ZoneSums zones =
        decodeZoneinfo("Node 0, zone  Normal\n  pages free  9\n        present  5\n"
                       "      nr_zspages   2\n  pagesets\n    cpu: 0\n              count:    3\n"
                       "              high:  9\n    cpu: 1\n              count:    4\n",
                       page);
    EXPECT_TRUE(zones.present == 5 * page && zones.onProcessorLists == 7 * page &&
                zones.compressed == 2 * page);

    const auto modules =
        decodeModules("ext4 8192 2 jbd2, Live 0x0000000000000000\nbroken\n\nnet 4096 0 - Live 0x0\n");
    ASSERT_EQ(modules.size(), 2U);
    EXPECT_TRUE(modules[1].name == "net" && modules[1].size == 4096);

    EXPECT_EQ(decodeKernelImage("00001000-0009fbff : System RAM\n  01000000-010000ff : Kernel code\n"
                                "  00000000-00000000 : Kernel data\n  2-1 : Kernel bss\n"),
              (std::map<std::string, std::uint64_t>{{"code", 256}, {"data", 0}}));
}

/// A /proc and /sys of the test's own.
class KernelTree : public testing::Test {
  protected:
    KernelTree() { setSystemRoot(folder_.path()); }
    ~KernelTree() override { setSystemRoot(""); }

    void write(const std::string& path, const std::string& text) {
        const std::filesystem::path file = folder_.path() + path;
        std::filesystem::create_directories(file.parent_path());
        std::ofstream(file) << text;
    }

    /// The sites that are wired, and those that are not, by name or "type:site".
    static std::pair<Sizes, Sizes> sitesOf(const mach_memory_record& record) {
        std::pair<Sizes, Sizes> sites;
        for (const mach_memory_site& site : record.sites) {
            const std::uint64_t type = site.flags & 0xff;
            const std::string name =
                !site.name.empty() ? site.name : std::to_string(type) + ":" + std::to_string(site.site);
            if (type != 3) {
                ((site.flags & 0x100) != 0 && site.site != 24 ? sites.first : sites.second)[name] =
                    site.size / 1024;
            }
        }
        return sites;
    }

    test::TemporaryFolder folder_;
};

constexpr const char* meminfo =
    "MemTotal: 10000 kB\nMemFree: 1000 kB\nBuffers: 100 kB\nCached: 2000 kB\nSwapCached: 50 kB\n"
    "Active: 1500 kB\nInactive: 3610 kB\nUnevictable: 0 kB\nMlocked: 40 kB\nAnonPages: 3000 kB\n"
    "Shmem: 300 kB\nSlab: 800 kB\nSReclaimable: 300 kB\nKernelStack: 64 kB\nPageTables: 200 kB\n"
    "SecPageTables: 8 kB\nVmallocUsed: 500 kB\nPercpu: 32 kB\nHugePages_Free: 1\n"
    "Hugetlb: 500 kB\nHugepagesize: 100 kB\n";

TEST_F(KernelTree, NamesEachByteOnceAndCloses) {
    write("/proc/meminfo", meminfo);
    write("/proc/zoneinfo", "present 3000\n nr_zspages 3\n count: 5\n count: 10\n");
    write("/proc/slabinfo", "a 10 10 100 1 1 : tunables 0 0 0 : slabdata 25 25 0\n"
                            "b 10 10 100 1 1 : tunables 0 0 0 : slabdata 150 150 0\n"
                            "never-used 0 0 100 1 1 : tunables 0 0 0 : slabdata 0 0 0\n");
    write("/sys/kernel/slab/b/reclaim_account", "1\n");
    write("/proc/vmallocinfo",
          "0x1-0x2 1 kernel_clone+0x9/0x3 pages=20 vmalloc\n0x1-0x2 1 load_module+0x9/0x3 pages=30 vmalloc\n"
          "0x1-0x2 1 htab_map_alloc+0x9/0x3 pages=75 vmalloc\n");
    write("/proc/modules", "ext4 81920 1 - Live 0x0\n");
    write("/proc/iomem", "1000-10ff : Kernel code\n");
    write("/proc/7/status", "VmPTE: 176 kB\n");
    mach_memory_record record;
    ASSERT_EQ(mach_memory_info(&record), KERN_SUCCESS);
    EXPECT_EQ(record.zone_names, (std::vector<std::string>{"a", "b"}));
    EXPECT_TRUE(record.zones[0].collectable == 0 && record.zones[1].collectable == 1);
    EXPECT_TRUE(record.notices.empty());
    const auto [dirty, clean] = sitesOf(record);
    const std::string module = "1:" + std::to_string(copyLoadedModuleIdentifiers().begin()->first);
    // Held: 10000 - 1000 free - 60 on lists - 5110 on the reclaim lists - 400 of huge pages in use = 3430.
    // Named: 800 of slabs, 500 of virtual memory, 8, 12, 32, 100; of 200 of page tables the process has 176
    // and the top-level one.
    const std::uint64_t tables = 176 + vm_kernel_page_size() / 1024;
    EXPECT_EQ(dirty, (Sizes{{"0:13", 100},
                            {"0:8", 64},
                            {"kernel_clone", 16},
                            {module, 80},
                            {"load_module", 40},
                            {"htab_map_alloc", 300},
                            {"0:9", 32},
                            {"0:10", 8},
                            {"0:15", 12},
                            {"huge page pool (unused)", 100},
                            {"other page tables", 200 - tables},
                            {"other kernel memory", 3430 - 800 - 500 - 8 - 12 - 32 - 100 - 200}}));
    EXPECT_EQ(clean, (Sizes{{"0:11", tables}, {"0:24", 40}, {"0:22", 1800}, {"kernel code", 0}}));
    std::map<std::uint64_t, std::uint64_t> counters;
    for (const mach_memory_site& site : record.sites) {
        if (site.flags == 3) {
            counters[site.site] = site.mapped / 1024;
        }
    }
    EXPECT_EQ(counters, (std::map<std::uint64_t, std::uint64_t>{
                            {0, 10000}, {1, 2000}, {2, 3430 - 300 + 40}, {6, 500}, {7, 800}, {11, 0}}));
}

TEST_F(KernelTree, MakesDoWithWhatAnOldOrUnwillingKernelTells) {
    write("/proc/meminfo", meminfo);
    write("/proc/iomem", "0-0 : Kernel code\n");
    write("/proc/modules", "huge 8192000 1 - Live 0x0\n"); // more than any row holds
    write("/proc/7/status", "VmPTE: 300 kB\n");            // upper levels are not in PageTables
    mach_memory_record record;
    ASSERT_EQ(mach_memory_info(&record), KERN_SUCCESS);
    auto [dirty, clean] = sitesOf(record);
    EXPECT_TRUE(record.zones.empty());
    EXPECT_EQ(dirty["0:12"], 800U) << "all slabs";
    EXPECT_EQ(dirty["vmalloc"], 500U - 64);
    EXPECT_EQ(dirty["0:8"], 64U);
    EXPECT_FALSE(dirty.contains("other page tables"));
    EXPECT_EQ(dirty["other kernel memory"],
              10000 - 1000 - 5110 - 400 - (800 + 500 + 8 + 32 + 100) - 300 - vm_kernel_page_size() / 1024);
    EXPECT_EQ(clean["1:" + std::to_string(copyLoadedModuleIdentifiers().begin()->first)], 8000U);
    EXPECT_EQ(record.notices,
              std::vector<std::string>{
                  "Not readable by this user: /proc/iomem. What they tell apart is shown in sums"});

    write("/proc/vmallocinfo", "0x1-0x2 1 htab_map_alloc+0x9/0x3 pages=75 vmalloc\n");
    ASSERT_EQ(mach_memory_info(&record), KERN_SUCCESS);
    EXPECT_EQ(sitesOf(record).first["0:8"], 64U) << "stacks that are no virtual memory";
    for (const char* text : {"", "MemFree: 1 kB\n"}) {
        write("/proc/meminfo", text);
        EXPECT_EQ(mach_memory_info(&record), KERN_FAILURE);
        EXPECT_TRUE(record.sites.empty());
    }
}

TEST(Kernel, OfThisMachineCloses) {
    std::vector<std::int32_t> pids(1);
    EXPECT_EQ(proc_listallpids(pids), 1);
    EXPECT_EQ(pids[0], 0);
    proc_bsdinfo info;
    EXPECT_EQ(proc_pidinfo(0, &info), static_cast<int>(sizeof(info)));
    EXPECT_EQ(info.pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    if (readSystemFile("/proc/2/comm") == "kthreadd\n") { // else pids are of a namespace of their own
        EXPECT_EQ(proc_pidinfo(2, &info), 0) << "a thread of the kernel";
    }

    mach_memory_record record;
    ASSERT_EQ(mach_memory_info(&record), KERN_SUCCESS);
    std::uint64_t kernel = 0;
    std::uint64_t other = 0;
    for (const mach_zone_info& zone : record.zones) {
        kernel += zone.current_size;
    }
    for (const mach_memory_site& site : record.sites) {
        const bool counts = (site.flags & 0x1ff) != 3 && (site.flags & 0x100) != 0 && site.site != 24;
        kernel += counts ? site.size : 0;
        other += site.name == "other kernel memory" ? site.size : 0;
    }
    const auto read = [](const char* path) { return readSystemFile(path).value_or(""); };
    const ZoneSums zones = decodeZoneinfo(read("/proc/zoneinfo"), vm_kernel_page_size());
    const Meminfo now(read("/proc/meminfo"));
    const double total = static_cast<double>(now["MemTotal"]);
    const std::uint64_t users = now["AnonPages"] + now["Cached"] + now["Buffers"] + now["SwapCached"] +
                                now["Hugetlb"] + now["PageTables"];
    EXPECT_NEAR(static_cast<double>(kernel + users + now["MemFree"] + zones.onProcessorLists), total,
                total / 100);
    EXPECT_LT(static_cast<double>(other), total / 100);
}

} // namespace
} // namespace tally::platform
