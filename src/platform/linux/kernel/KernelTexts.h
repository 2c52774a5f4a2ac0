// The kernel's own accounts of its memory below /proc, decoded. All sizes are bytes.
//
// Each takes what it can read of a text and passes over the rest: a line in a form that it does not know is
// no reason to lose the others.

#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace tally::platform {

/// Rows of /proc/meminfo by their key. Those that are counts and not kB, as "HugePages_Free", stay counts.
class Meminfo {
  public:
    explicit Meminfo(std::string_view text);
    /// 0 for a row that this kernel does not have.
    std::uint64_t operator[](std::string_view key) const;
    bool empty() const { return rows_.empty(); }

  private:
    std::map<std::string, std::uint64_t, std::less<>> rows_;
};

// Texts that count in pages are told the machine's page size, bytes.

/// One cache of /proc/slabinfo.
struct SlabCache {
    std::string name;
    std::uint64_t elementsInUse = 0;
    std::uint64_t elementSize = 0;
    std::uint64_t size = 0; // of all its slabs
};
std::vector<SlabCache> decodeSlabinfo(std::string_view text, std::uint64_t pageSize);

/// What /proc/vmallocinfo says that each caller holds, by its symbol, "name" or "name [module]". Areas that
/// map what is not theirs (devices, pages that others count) own nothing.
using VmallocRows = std::map<std::string, std::uint64_t, std::less<>>;
VmallocRows decodeVmallocinfo(std::string_view text, std::uint64_t pageSize);

/// Sums over the zones of /proc/zoneinfo.
struct ZoneSums {
    std::uint64_t onProcessorLists = 0; // free, but on the lists that each processor has for itself
    std::uint64_t present = 0;          // physical memory, with what was reserved at boot
    std::uint64_t compressed = 0;       // what compressed pages take up
};
ZoneSums decodeZoneinfo(std::string_view text, std::uint64_t pageSize);

struct LoadedModule {
    std::string name;
    std::uint64_t size = 0;
};
/// The lines of /proc/modules.
std::vector<LoadedModule> decodeModules(std::string_view text);

/// Sizes of "Kernel code", "Kernel data" and so on in /proc/iomem, by the second word. To ordinary users the
/// kernel tells addresses of 0: then sizes are 0 as well.
std::map<std::string, std::uint64_t> decodeKernelImage(std::string_view iomem);

} // namespace tally::platform
