// Walks the page tables of processes and says which of them hold each page, by frame number at whatever
// address.
//
//   frames PID...
//
// Prints a line for each exact set of holders: "anonymous|shmem|swapped BYTES PID,PID,...", every page once.
// Then for each process "freed BYTES PID", its lazily freed memory (part of "anonymous"), which smaps tells:
// whether a page was written again is in its dirty bit, which nothing else shows. Shared memory in swap is in
// nobody's page table, so not here. The zero page and pages of files on disk count nowhere. The processes
// must hold still. Root only: exit status 77 where frame numbers are hidden or the kernel cannot scan.

#include <fcntl.h>
#include <linux/kernel-page-flags.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <map>
#include <string>
#include <utility>
#include <vector>

namespace {

// As in linux/fs.h from 6.7 on, which the headers of this machine may not have.
struct Region {
    std::uint64_t start, end, categories;
};
struct ScanArguments {
    std::uint64_t size, flags, start, end, walkEnd, regions, regionCount, mostPages;
    std::uint64_t inverted, required, anyOf, returned;
};
constexpr unsigned long scanPagemap = _IOWR('f', 16, ScanArguments);
constexpr std::uint64_t present = 8;
constexpr std::uint64_t swapped = 16;

constexpr std::uint64_t page = 4096;
constexpr std::uint64_t endOfAddresses = 0x7fff'ffff'f000;
constexpr std::uint64_t swapKey = std::uint64_t{1} << 63;

/// A page of the process at `holder`: its frame, or swapKey and its place in swap.
using Held = std::pair<std::uint64_t, std::uint32_t>;
using Holders = std::vector<std::uint32_t>;

[[noreturn]] void fail(int status, const std::string& what) {
    std::fprintf(stderr, "frames: %s\n", what.c_str());
    std::exit(status);
}

int openOrFail(const std::string& path) {
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (file < 0) {
        fail(1, path + " cannot be read");
    }
    return file;
}

/// How many areas of swap there are. Entries of higher types are marks (guards, pages on the move), not
/// memory.
std::uint64_t swapAreas() {
    std::ifstream file("/proc/swaps");
    std::uint64_t lines = 0;
    for (std::string line; std::getline(file, line);) {
        ++lines;
    }
    return lines == 0 ? 0 : lines - 1;
}

void readEntries(int pagemap, const Region& region, std::uint32_t holder, std::vector<Held>& pages) {
    static const std::uint64_t areas = swapAreas();
    constexpr std::uint64_t mostEntries = 4096;
    std::vector<std::uint64_t> entries(mostEntries);
    for (std::uint64_t at = region.start; at < region.end;) {
        const std::uint64_t wanted = std::min((region.end - at) / page, mostEntries);
        const ssize_t bytes = pread(pagemap, entries.data(), wanted * 8, static_cast<off_t>(at / page * 8));
        if (bytes <= 0) {
            fail(1, "pagemap ends early");
        }
        for (std::uint64_t i = 0; i < static_cast<std::uint64_t>(bytes) / 8; ++i) {
            const std::uint64_t number = entries[i] & ((std::uint64_t{1} << 55) - 1);
            if ((entries[i] >> 63) != 0) {
                if (number == 0) {
                    fail(77, "frame numbers are hidden");
                }
                pages.emplace_back(number, holder);
            } else if ((entries[i] >> 62 & 1) != 0 && (number & 31) < areas) {
                pages.emplace_back(swapKey | number, holder);
            }
        }
        at += static_cast<std::uint64_t>(bytes) / 8 * page;
    }
}

void walk(const std::string& folder, std::uint32_t holder, std::vector<Held>& pages) {
    const int pagemap = openOrFail(folder + "/pagemap");
    std::vector<Region> regions(1024);
    ScanArguments scan{};
    scan.size = sizeof(scan);
    scan.end = endOfAddresses;
    scan.regions = reinterpret_cast<std::uintptr_t>(regions.data());
    scan.regionCount = regions.size();
    scan.anyOf = scan.returned = present | swapped;
    for (std::size_t count = regions.size(); count == regions.size();) {
        const int found = ioctl(pagemap, scanPagemap, &scan);
        if (found < 0) {
            fail(77, "this kernel cannot scan page tables");
        }
        count = static_cast<std::size_t>(found);
        for (std::size_t i = 0; i < count; ++i) {
            readEntries(pagemap, regions[i], holder, pages);
        }
        // The end that the kernel tells is at times that of an earlier part of this call.
        scan.start = count == 0 ? scan.end : std::max(scan.walkEnd, regions[count - 1].end);
    }
    close(pagemap);
}

/// What the kernel says of frames, which are asked for in rising order.
class FrameFlags {
  public:
    std::uint64_t of(std::uint64_t frame) {
        std::uint64_t flags = read(frame);
        if ((flags >> KPF_COMPOUND_TAIL & 1) != 0) { // kernels before 6.9 tell some flags of the head only
            std::uint64_t head = frame;
            while ((read(head) >> KPF_COMPOUND_TAIL & 1) != 0) {
                --head;
            }
            flags |= read(head);
        }
        return flags;
    }

  private:
    std::uint64_t read(std::uint64_t frame) {
        if (frame / buffer_.size() != window_) {
            window_ = frame / buffer_.size();
            std::fill(buffer_.begin(), buffer_.end(), 0);
            if (pread(file_, buffer_.data(), buffer_.size() * 8,
                      static_cast<off_t>(window_ * buffer_.size() * 8)) <= 0) {
                fail(1, "/proc/kpageflags ends early");
            }
        }
        return buffer_[frame % buffer_.size()];
    }

    int file_ = openOrFail("/proc/kpageflags");
    std::uint64_t window_ = ~std::uint64_t{0};
    std::vector<std::uint64_t> buffer_ = std::vector<std::uint64_t>(4096);
};

std::uint64_t lazilyFreed(const std::string& folder) {
    std::ifstream file(folder + "/smaps");
    std::uint64_t bytes = 0;
    for (std::string line; std::getline(file, line);) {
        if (line.starts_with("LazyFree:")) {
            bytes += std::stoull(line.substr(9)) * 1024;
        }
    }
    return bytes;
}

const char* kindOf(std::uint64_t key, FrameFlags& frames) {
    if ((key & swapKey) != 0) {
        return "swapped";
    }
    const std::uint64_t flags = frames.of(key);
    return (flags >> KPF_ANON & 1) != 0         ? "anonymous"
           : (flags >> KPF_SWAPBACKED & 1) != 0 ? "shmem"
                                                : nullptr;
}

} // namespace

int main(int argc, char** argv) {
    std::vector<Held> pages;
    for (int i = 1; i < argc; ++i) {
        walk(std::string("/proc/") + argv[i], static_cast<std::uint32_t>(i), pages);
    }
    std::sort(pages.begin(), pages.end());

    std::map<std::pair<std::string, Holders>, std::uint64_t> sets;
    FrameFlags frames;
    for (auto first = pages.begin(); first != pages.end();) {
        const auto last =
            std::find_if(first, pages.end(), [&](const Held& each) { return each.first != first->first; });
        if (const char* kind = kindOf(first->first, frames)) {
            Holders holders;
            for (auto each = first; each != last; ++each) {
                if (holders.empty() || holders.back() != each->second) {
                    holders.push_back(each->second);
                }
            }
            sets[{kind, holders}] += page;
        }
        first = last;
    }

    for (const auto& [set, bytes] : sets) {
        std::printf("%s %llu ", set.first.c_str(), static_cast<unsigned long long>(bytes));
        for (const std::uint32_t holder : set.second) {
            std::printf("%s%s", holder == set.second.front() ? "" : ",", argv[holder]);
        }
        std::printf("\n");
    }
    for (int i = 1; i < argc; ++i) {
        std::printf("freed %llu %s\n",
                    static_cast<unsigned long long>(lazilyFreed(std::string("/proc/") + argv[i])), argv[i]);
    }
}
