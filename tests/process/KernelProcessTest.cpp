#include "base/Format.h"
#include "platform/scripted/ScriptedKernel.h"
#include "process/TLKernelProcess.h"

#include <gtest/gtest.h>

namespace tally {
namespace {

using namespace platform;

constexpr std::uint64_t wired = 0x100;
constexpr std::uint64_t hidden = 0x200;
constexpr std::uint64_t named = 0x400;
constexpr std::uint64_t ofZone = 0x800;

class KernelProcess : public testing::Test {
  protected:
    KernelProcess() { kernel.addTask({.pid = 0, .name = "kernel", .flags = PROC_FLAG_SYSTEM}); }

    /// Gathers the kernel. @return what a region is called, in front of its sizes and after "w" when wired.
    std::vector<std::string> gathered() {
        process = TLProcess::processWithPid(0);
        process->gatherData();
        std::vector<std::string> lines;
        for (const TLMemoryRegion& region : process->memoryRegions()) {
            lines.push_back(formatted("%s d%ld c%ld r%ld%s", region.fullName().c_str(), region.dirtySize,
                                      region.cleanNonSpecSize, region.reclaimableSize,
                                      region.wired ? " w" : ""));
        }
        return lines;
    }

    std::string only(mach_memory_site site) {
        kernel.memory.sites = {std::move(site)};
        const auto lines = gathered();
        return lines.size() == 1 ? lines[0] : formatted("%zu regions", lines.size());
    }

    TLAuxDictionary counters() const { return process->auxData()->entries.at("Maps").dictionary(); }

    ScriptedKernel kernel;
    std::shared_ptr<TLProcess> process;
};

TEST_F(KernelProcess, ZonesAreDirtyButForWhatTheyCanGiveBack) {
    const std::string longName(90, 'z');
    kernel.memory.zone_names = {"fixed",       "collectable", "racing", longName, std::string("cut\0off", 7),
                                "no\xff text", "extra"};
    kernel.memory.zones = {
        {.elements_in_use = 1, .current_size = 65536, .element_size = 64},
        {.elements_in_use = 10, .current_size = 4096, .element_size = 64, .collectable = 7},
        {.elements_in_use = 99, .current_size = 4096, .element_size = 64, .collectable = 1},
        {.current_size = 1},
        {.current_size = 2},
        {.current_size = 3}};
    EXPECT_EQ(gathered(), (std::vector<std::string>{
                              "fixed d65536 c0 r0", "collectable d640 c0 r3456", "racing d4096 c0 r0",
                              longName.substr(0, 80) + " d1 c0 r0", "cut d2 c0 r0", "unknown d3 c0 r0"}));
    EXPECT_EQ(process->memoryRegions()[1].object_id, 0x2'0000'0001U);
    EXPECT_EQ(process->memoryRegions()[1].size, 4096U);
    EXPECT_EQ(process->displayString(), "kernel [0]");
    EXPECT_EQ(process->idleExitStatus(), TLIdleExitStatus::notTracked);
}

TEST_F(KernelProcess, SitesAreDirtyOnlyWhereNothingElseCountsThem) {
    kernel.memory.zone_names = {"a", "b", "c", "zone3"};
    kernel.loadedModules = {{5, "net.driver"}, {6, ""}, {8, "\xff"}};
    kernel.kernelSymbols = {{{.start = 0x8000, .size = 0x100, .name = "alloc", .source{{"mm/alloc.c", 12}}},
                             {.start = 0x9000, .size = 0x100, .name = "free"},
                             {.start = 0xB000, .size = 0x100, .name = ""}}};
    const std::pair<mach_memory_site, std::string> cases[] = {
        {{.flags = wired, .site = 13, .size = 8192, .mapped = 1}, "VM_KERN_MEMORY_KALLOC d8192 c0 r0 w"},
        {{.flags = 0, .site = 13, .size = 8192}, "VM_KERN_MEMORY_KALLOC d0 c8192 r0"},
        {{.flags = wired | ofZone, .site = 13, .size = 8}, "VM_KERN_MEMORY_KALLOC[a] d0 c8 r0 w"},
        {{.flags = wired, .site = 24, .size = 8}, "VM_KERN_MEMORY_MLOCK (user wired) d0 c8 r0 w"},
        {{.flags = wired | hidden, .site = 24, .size = 8}, "VM_KERN_MEMORY_MLOCK (hidden) d0 c8 r0 w"},
        {{.flags = hidden, .site = 1, .size = 8}, "VM_KERN_MEMORY_OSFMK (hidden) d0 c8 r0"},
        {{.flags = wired, .site = 0, .size = 8}, "VM_KERN_MEMORY_NONE d8 c0 r0 w"},
        {{.flags = wired, .site = 0, .size = 0, .mapped = 8}, "0 regions"},
        {{.flags = wired, .site = 33, .size = 0}, "VM_KERN_MEMORY_FIRST_DYNAMIC d0 c0 r0 w"},
        {{.flags = wired, .site = 40, .size = 8}, "VM_KERN_MEMORY_40 d8 c0 r0 w"},
        {{.flags = wired, .site = 255, .size = 8}, "VM_KERN_MEMORY_ANY d8 c0 r0 w"},
        {{.flags = wired | 1, .site = 5, .size = 8}, "net.driver d8 c0 r0 w"},
        {{.flags = wired | 1, .site = 6, .size = 8}, "unloaded kmod 6 d8 c0 r0 w"},
        {{.flags = wired | 1, .site = 7, .size = 8}, "unloaded kmod 7 d8 c0 r0 w"},
        {{.flags = wired | 1, .site = 8, .size = 8}, "unloaded kmod 8 d8 c0 r0 w"},
        {{.flags = wired | 2, .site = 0x80ff, .size = 8}, "alloc (mm/alloc.c:12) d8 c0 r0 w"},
        {{.flags = hidden | 2, .site = 0x8000, .size = 8}, "alloc (mm/alloc.c:12) d0 c8 r0"},
        {{.flags = wired | 2, .site = 0x9000, .size = 8}, "free d8 c0 r0 w"},
        {{.flags = wired | 2, .site = 0xA000, .size = 8}, "site 0xa000 d8 c0 r0 w"},
        {{.flags = wired | 2, .site = 0xB000, .size = 8}, "site 0xb000 d8 c0 r0 w"},
        {{.flags = wired | 2, .site = 0, .size = 8}, "site 0x0 d8 c0 r0 w"},
        {{.flags = wired | 3, .site = 6, .size = 8}, "VM_KERN_COUNT_MAP_KERNEL d8 c0 r0 w"},
        {{.flags = ofZone | 3, .site = 20, .size = 8, .zone = 1}, "VM_KERN_COUNT_20[b] d0 c8 r0"},
        {{.flags = 0x2a, .site = 0x1f, .size = 8}, "unknown site (0x2a, 0x1f) d0 c8 r0"},
        {{.flags = named | ofZone, .site = 1, .size = 8, .zone = 3, .name = "foo"}, "foo[zone3] d0 c8 r0"},
        {{.flags = named | ofZone, .site = 1, .size = 8, .zone = 4, .name = "foo"}, "foo d0 c8 r0"},
        {{.flags = named, .site = 1, .size = 8, .zone = 3, .name = "foo"}, "foo d0 c8 r0"},
        {{.flags = named, .site = 1, .size = 8, .name = ""}, "VM_KERN_MEMORY_OSFMK d0 c8 r0"},
        {{.flags = named | 1, .site = 5, .size = 8, .name = "\xff"}, "net.driver d0 c8 r0"},
    };
    for (const auto& [site, line] : cases) {
        EXPECT_EQ(only(site), line);
    }
    kernel.kernelSymbols.reset();
    EXPECT_EQ(only({.flags = wired | 2, .site = 0x8000, .size = 8}), "site 0x8000 d8 c0 r0 w");

    kernel.memory.zones = {{.current_size = 1}};
    kernel.memory.sites = {{.flags = wired}, {.flags = wired, .site = 1, .size = 8}};
    ASSERT_EQ(gathered().size(), 2u);
    const TLMemoryRegion& site = process->memoryRegions()[1];
    EXPECT_EQ(site.object_id, 0x1'0000'0001U) << "the entry's number, though one before it was left out";
    EXPECT_TRUE(site.user_tag == 1 && site.size == 8);
}

TEST_F(KernelProcess, CountersAreNoMemory) {
    kernel.memory.zone_names = {"zone"};
    kernel.memory.sites = {{.flags = 3, .site = 6, .size = 1, .mapped = 70},
                           {.flags = 3 | hidden, .site = 20, .mapped = 80},
                           {.flags = 3 | named, .site = 0, .mapped = 90, .name = "own"},
                           {.flags = 3, .site = 0, .size = 5}, // nothing is mapped
                           {.flags = 3, .site = 13}};
    EXPECT_EQ(gathered(), std::vector<std::string>());
    const auto leaf = [](std::int64_t value) { return TLAuxData(value, false); };
    EXPECT_EQ(counters(), (TLAuxDictionary{{{"VM_KERN_COUNT_MAP_KERNEL", leaf(70)},
                                            {"VM_KERN_COUNT_20", leaf(80)},
                                            {"own", leaf(90)},
                                            {"VM_KERN_COUNT_MAP_KERNEL_DATA", leaf(0)}}}));
}

TEST_F(KernelProcess, SaysWhatItWasRefused) {
    kernel.memory.sites = {{.flags = wired, .site = 13, .size = 8}};
    kernel.memory.notices = {"some file"};
    gathered();
    EXPECT_EQ(process->warnings(), std::vector<std::string>{"some file"});
    EXPECT_FALSE(process->hasErrors());

    kernel.fail("mach_memory_info", KERN_NO_ACCESS);
    testing::internal::CaptureStderr();
    EXPECT_EQ(gathered().size(), 0u);
    EXPECT_EQ(testing::internal::GetCapturedStderr(), "kernel [0]: mach_memory_info: no access\n");
    EXPECT_EQ(process->errors(), std::vector<std::string>{"kernel [0]: no access"});
    EXPECT_FALSE(process->hasMemoryRegions());
    EXPECT_TRUE(counters().entries.empty());
}

} // namespace
} // namespace tally
