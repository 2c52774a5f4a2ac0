// The kernel's memory as zones, sites and counters.
//
// The idea: what the machine has less what is free and what processes and the page cache hold is the
// kernel's. As much of that as the kernel can name is taken apart, each byte once; the rest is a site of its
// own. So the figures always close with /proc/meminfo. What counts elsewhere (page tables and locked memory
// of processes, cached files) or is no part of MemTotal (the kernel's image) is not marked as wired, and so
// is shown as clean only.

#include "platform/bsd_process.h"
#include "platform/linux/io/Pages.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/kernel/KernelTexts.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"
#include "platform/mach_kernel_memory.h"

#include <algorithm>
#include <cerrno>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

// Sites of the kernel's table of tags.
constexpr std::uint64_t stackTag = 8;
constexpr std::uint64_t processorTag = 9;
constexpr std::uint64_t pageMapTag = 10;
constexpr std::uint64_t pageTableTag = 11;
constexpr std::uint64_t zoneTag = 12;
constexpr std::uint64_t allocationTag = 13;
constexpr std::uint64_t compressedTag = 15;
constexpr std::uint64_t fileCacheTag = 22;

// Counters.
constexpr std::uint64_t managedCount = 0;
constexpr std::uint64_t reservedCount = 1;
constexpr std::uint64_t wiredCount = 2;
constexpr std::uint64_t kernelMapCount = 6;
constexpr std::uint64_t zoneMapCount = 7;
constexpr std::uint64_t kernelImageCount = 11;

constexpr std::string_view allOfVmalloc = "vmalloc"; // where the kernel does not tell the callers

std::uint64_t difference(std::uint64_t a, std::uint64_t b) { return a > b ? a - b : 0; }

/// Where the kernel allocates the stacks of threads; which of these it names depends on what was inlined.
bool allocatesStacks(std::string_view symbol) {
    constexpr std::string_view symbols[] = {"kernel_clone",    "copy_process",
                                            "dup_task_struct", "alloc_thread_stack_node",
                                            "fork_idle",       allOfVmalloc};
    return std::ranges::find(symbols, symbol) != std::end(symbols);
}

bool loadsModules(std::string_view symbol) {
    return symbol.find("module") != std::string_view::npos || symbol.starts_with("execmem") ||
           symbol == allOfVmalloc;
}

/// Takes up to `wanted` bytes off the rows whose symbol `matches`. @return how many there were.
std::uint64_t takeOff(VmallocRows& rows, bool (*matches)(std::string_view), std::uint64_t wanted) {
    std::uint64_t taken = 0;
    for (auto& [symbol, bytes] : rows) {
        if (matches(symbol)) {
            const std::uint64_t part = std::min(bytes, wanted - taken);
            bytes -= part;
            taken += part;
        }
    }
    return taken;
}

/// A load tag for a module: the kernel gives it no number.
std::uint64_t loadTag(const std::string& name) { return std::hash<std::string>()(name); }

/// Bytes of page tables that processes are charged for.
std::uint64_t chargedPageTables() {
    std::vector<std::int32_t> pids(static_cast<std::size_t>(std::max(proc_listallpids({}), 0)));
    pids.resize(static_cast<std::size_t>(std::max(proc_listallpids(pids), 0)));
    std::uint64_t sum = 0;
    for (const std::int32_t pid : pids) {
        const std::optional<Charges> charges = readCharges(pid, false, {});
        sum += charges ? charges->pageTable : 0;
    }
    return sum;
}

class KernelRecord {
  public:
    explicit KernelRecord(const Meminfo& meminfo) : meminfo_(meminfo) {}

    mach_memory_record take();

  private:
    std::optional<std::string> read(const std::string& path);
    void addZones();
    void addVirtualMemory();
    void addRowsOfMeminfo();
    void addClean();
    void addRest();
    void addCounters();
    void tellRefusals();

    /// Adds a site that nothing else counts.
    void addWired(std::uint64_t type, std::uint64_t site, std::uint64_t size, std::string name = "") {
        add(type | kernelSiteIsWired, site, size, std::move(name));
        accounted_ += size;
    }
    void add(std::uint64_t flags, std::uint64_t site, std::uint64_t size, std::string name = "") {
        if (size != 0) {
            record_.sites.push_back({.flags = flags | (name.empty() ? 0 : kernelSiteIsNamed),
                                     .site = site,
                                     .size = size,
                                     .name = std::move(name)});
        }
    }
    void addCounter(std::uint64_t counter, std::uint64_t value) {
        record_.sites.push_back(
            {.flags = kernelSiteIsCounter, .site = counter, .size = value, .mapped = value});
    }

    const Meminfo& meminfo_;
    ZoneSums zones_ = decodeZoneinfo(readSystemFile(systemPath("/proc/zoneinfo")).value_or(""), basePage);
    const std::uint64_t userPageTables_ = chargedPageTables();
    mach_memory_record record_;
    std::uint64_t accounted_ = 0; // bytes of zones and wired sites
    std::uint64_t held_ = 0;      // bytes that the kernel holds
    std::uint64_t imageSize_ = 0;
    std::vector<std::string> refused_; // files
};

mach_memory_record KernelRecord::take() {
    // On the lists that pages are reclaimed from stands all user memory, each page once; to AnonPages and
    // Cached the swap cache adds pages that one of them has already.
    const std::uint64_t listed = meminfo_["Active"] + meminfo_["Inactive"] + meminfo_["Unevictable"];
    const std::uint64_t counted = meminfo_["AnonPages"] + meminfo_["Cached"] + meminfo_["Buffers"];
    const std::uint64_t hugePagesFree = meminfo_["HugePages_Free"] * meminfo_["Hugepagesize"];
    const std::uint64_t users = std::max(listed, counted) + difference(meminfo_["Hugetlb"], hugePagesFree);
    const std::uint64_t free = meminfo_["MemFree"] + zones_.onProcessorLists;
    held_ = difference(meminfo_["MemTotal"], free + users);
    addZones();
    addVirtualMemory();
    addRowsOfMeminfo();
    addWired(kernelSiteIsTag, 0, hugePagesFree, "huge page pool (unused)");
    addRest();
    addClean();
    addCounters();
    tellRefusals();
    return std::move(record_);
}

/// Reads a file of which rights may not allow to read it.
std::optional<std::string> KernelRecord::read(const std::string& path) {
    std::optional<std::string> text = readSystemFile(systemPath(path));
    if (!text && statusForErrno(errno) == KERN_NO_ACCESS) {
        refused_.push_back(path);
    }
    return text;
}

void KernelRecord::addZones() {
    std::uint64_t inCaches = 0;
    for (SlabCache& cache : decodeSlabinfo(read("/proc/slabinfo").value_or(""), basePage)) {
        if (cache.size == 0) {
            continue; // most are never used
        }
        const std::string folder = systemPath("/sys/kernel/slab/" + cache.name);
        const bool isReclaimable = readSystemFile(folder + "/reclaim_account").value_or("0").starts_with('1');
        record_.zones.push_back({.elements_in_use = cache.elementsInUse,
                                 .current_size = cache.size,
                                 .element_size = cache.elementSize,
                                 .collectable = isReclaimable ? 1U : 0U});
        record_.zone_names.push_back(std::move(cache.name));
        inCaches += cache.size;
    }
    accounted_ += inCaches;
    // Large allocations have no cache. Where the caches may not be read this is all of them.
    addWired(kernelSiteIsTag, record_.zones.empty() ? zoneTag : allocationTag,
             difference(meminfo_["Slab"], inCaches));
}

void KernelRecord::addVirtualMemory() {
    const std::optional<std::string> text = read("/proc/vmallocinfo");
    VmallocRows rows = text ? decodeVmallocinfo(*text, basePage)
                            : VmallocRows{{std::string(allOfVmalloc), meminfo_["VmallocUsed"]}};
    // Stacks are virtual memory too; where none of it is theirs they are apart.
    const std::uint64_t stacks = takeOff(rows, allocatesStacks, meminfo_["KernelStack"]);
    addWired(kernelSiteIsTag, stackTag, stacks != 0 ? stacks : meminfo_["KernelStack"]);

    const std::vector<LoadedModule> modules =
        decodeModules(readSystemFile(systemPath("/proc/modules")).value_or(""));
    std::uint64_t ofModules = 0;
    for (const LoadedModule& module : modules) {
        ofModules += module.size;
    }
    VmallocRows withoutModules = rows;
    const bool areFound = takeOff(withoutModules, loadsModules, ofModules) == ofModules;
    for (const LoadedModule& module : modules) {
        if (areFound) {
            addWired(kernelSiteIsModule, loadTag(module.name), module.size);
        } else { // some other row holds them
            add(kernelSiteIsModule, loadTag(module.name), module.size);
        }
    }
    for (const auto& [symbol, bytes] : areFound ? withoutModules : rows) {
        addWired(kernelSiteIsCode, 0, bytes, symbol);
    }
}

void KernelRecord::addRowsOfMeminfo() {
    addWired(kernelSiteIsTag, processorTag, meminfo_["Percpu"]);
    addWired(kernelSiteIsTag, pageMapTag, meminfo_["SecPageTables"]); // of virtual machines and devices
    addWired(kernelSiteIsTag, compressedTag, zones_.compressed);
    // Since 6.12 the kernel's own are among them, before it not even all of the processes' are.
    addWired(kernelSiteIsTag, 0, difference(meminfo_["PageTables"], userPageTables_), "other page tables");
}

void KernelRecord::addRest() {
    addWired(kernelSiteIsTag, 0, difference(held_, accounted_ + userPageTables_), "other kernel memory");
}

/// What counts elsewhere.
void KernelRecord::addClean() {
    add(kernelSiteIsTag, pageTableTag, userPageTables_);
    add(kernelSiteIsTag | kernelSiteIsWired, kernelTagMlock, meminfo_["Mlocked"]);
    add(kernelSiteIsTag, fileCacheTag,
        difference(meminfo_["Cached"] + meminfo_["Buffers"], meminfo_["Shmem"]));
    const std::optional<std::string> iomem = read("/proc/iomem");
    for (const auto& [part, size] : decodeKernelImage(iomem.value_or(""))) {
        add(kernelSiteIsTag, 0, size, "kernel " + part);
        imageSize_ += size;
    }
    if (iomem && imageSize_ == 0) {
        refused_.emplace_back("/proc/iomem");
    }
}

void KernelRecord::addCounters() {
    addCounter(managedCount, meminfo_["MemTotal"]);
    addCounter(reservedCount, difference(zones_.present, meminfo_["MemTotal"]));
    addCounter(wiredCount, difference(held_, meminfo_["SReclaimable"]) + meminfo_["Mlocked"]);
    addCounter(kernelMapCount, meminfo_["VmallocUsed"]);
    addCounter(zoneMapCount, meminfo_["Slab"]);
    if (imageSize_ != 0) {
        addCounter(kernelImageCount, imageSize_);
    }
}

void KernelRecord::tellRefusals() {
    if (refused_.empty()) {
        return;
    }
    std::string files;
    for (const std::string& file : refused_) {
        files += (files.empty() ? "" : ", ") + file;
    }
    record_.notices.push_back("Not readable by this user: " + files +
                              ". What they tell apart is shown in sums");
}

} // namespace

kern_return_t mach_memory_info(mach_memory_record* record) {
    *record = mach_memory_record();
    const std::optional<std::string> text = readSystemFile(systemPath("/proc/meminfo"));
    if (!text) {
        return statusForErrno(errno) == KERN_NO_ACCESS ? KERN_NO_ACCESS : KERN_FAILURE;
    }
    const Meminfo meminfo(*text);
    if (meminfo["MemTotal"] == 0) {
        return KERN_FAILURE;
    }
    *record = KernelRecord(meminfo).take();
    return KERN_SUCCESS;
}

std::map<std::uint64_t, std::string> copyLoadedModuleIdentifiers() {
    std::map<std::uint64_t, std::string> identifiers;
    for (LoadedModule& module : decodeModules(readSystemFile(systemPath("/proc/modules")).value_or(""))) {
        const std::uint64_t tag = loadTag(module.name);
        identifiers.emplace(tag, std::move(module.name));
    }
    return identifiers;
}

} // namespace tally::platform
