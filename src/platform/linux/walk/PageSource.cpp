#include "platform/linux/walk/PageSource.h"

#include "platform/linux/walk/PagemapEntry.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <optional>

namespace tally::platform {

namespace {

// The kernel takes twice the time when it is asked to tell file pages from others. Private anonymous memory
// has none, so neighbouring anonymous mappings of this many bytes in all are scanned without.
constexpr std::uint64_t worthOwnScan = 1 << 20;

std::atomic<bool> scansAnswered = true; // false once this kernel has refused one

std::uint64_t sizeInside(const Mapping& mapping, AddressRange window) {
    const std::uint64_t start = std::max(mapping.start, window.start);
    const std::uint64_t end = std::min(mapping.end, window.end);
    return end > start ? end - start : 0;
}

/// Consecutive mappings that are scanned in one go.
struct Segment {
    std::size_t end = 0;
    bool withFile = false;
};

Segment segmentAt(std::span<const Mapping> mappings, std::size_t first, std::size_t end,
                  AddressRange window) {
    const auto anonymousEnd = [&](std::size_t at, std::uint64_t* bytes) {
        for (*bytes = 0; at < end && mappings[at].isPrivateAnonymous(); ++at) {
            *bytes += sizeInside(mappings[at], window);
        }
        return at;
    };
    std::uint64_t bytes = 0;
    std::size_t at = anonymousEnd(first, &bytes);
    if (bytes >= worthOwnScan) {
        return {at, false};
    }
    // Up to the next anonymous mappings that are worth a scan of their own.
    while (at < end) {
        const std::size_t next = anonymousEnd(at + 1, &bytes);
        if (bytes >= worthOwnScan) {
            return {at + 1, true};
        }
        at = next;
    }
    return {end, true};
}

std::optional<PageKind> kindOfRegion(const PageRegion& region) {
    if ((region.categories & (PageIsZero | PageIsGuard)) != 0) {
        return std::nullopt; // no memory
    }
    return (region.categories & PageIsFile) != 0      ? PageKind::object
           : (region.categories & PageIsPresent) != 0 ? PageKind::anonymous
                                                      : PageKind::swapped;
}

} // namespace

int PageSource::read(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                     std::size_t* reached) {
    *reached = first;
    while (scansAnswered && *reached < end) {
        const Segment segment = segmentAt(mappings_, *reached, end, window);
        const int error = scan(*reached, segment.end, window, segment.withFile, sink, reached);
        if (error == ENOTTY) {
            scansAnswered = false;
        } else if (error != 0) {
            return error;
        }
    }
    return *reached < end ? readOlder(*reached, end, window, sink, reached) : 0;
}

int PageSource::scan(std::size_t first, std::size_t end, AddressRange window, bool withFile,
                     const PageRunSink& sink, std::size_t* reached) {
    std::size_t mapping = first;
    const std::uint64_t last = std::min(window.end, mappings_[end - 1].end);
    for (std::uint64_t address = std::max(window.start, mappings_[first].start); address < last;) {
        PageScanStep step;
        *reached = mapping;
        if (const int error = scanPages(files_.pagemap.number(), address, last, withFile, room_, &step);
            error != 0) {
            return error;
        }
        if (!isAlive()) {
            return ESRCH; // of an address space that went away meanwhile a scan shows a part or nothing
        }
        for (const PageRegion& region : step.regions) {
            // A region can reach over several mappings and what lies between them.
            while (mapping < end && mappings_[mapping].end <= region.start) {
                ++mapping;
            }
            const std::optional<PageKind> kind = memoryOf(kindOfRegion(region));
            for (std::size_t at = mapping; kind && at < end && mappings_[at].start < region.end; ++at) {
                sink(at, std::max(region.start, mappings_[at].start), std::min(region.end, mappings_[at].end),
                     *kind);
            }
        }
        address = step.resume;
        while (mapping < end && mappings_[mapping].end <= address) {
            ++mapping;
        }
        if (mapping < end) {
            address = std::max(address, mappings_[mapping].start); // what lies between is not scanned
        }
    }
    *reached = end;
    return 0;
}

/// Without swap, what shows as swapped are marks that userfaultfd left where there is no memory.
std::optional<PageKind> PageSource::memoryOf(std::optional<PageKind> kind) const {
    return kind == PageKind::swapped && !swapInUse_ ? std::nullopt : kind;
}

bool PageSource::isAlive() const {
    std::uint64_t entry = 0;
    return readPagemapEntries(files_.pagemap, 0, std::span(&entry, 1)) == 1;
}

int PageSource::readOlder(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                          std::size_t* reached) {
    for (*reached = first; *reached < end; ++*reached) {
        const Mapping& mapping = mappings_[*reached];
        if (!smaps_.isReadable()) {
            return ESRCH;
        }
        const SmapsEntry* entry = smaps_.entryFor(mapping);
        if (entry == nullptr || entry->resident + entry->swapped + entry->hugetlb == 0) {
            continue; // empty, or unmapped meanwhile
        }
        if (mapping.isPrivateAnonymous() && detail_ == PageDetail::counts) {
            const std::uint64_t resident = mapping.start + std::min(entry->resident, mapping.size());
            sink(*reached, mapping.start, resident, PageKind::anonymous);
            sink(*reached, resident, std::min(resident + entry->swapped, mapping.end), PageKind::swapped);
        } else if (!readPagemap(*reached, window, sink)) {
            return ESRCH;
        }
    }
    return 0;
}

bool PageSource::readPagemap(std::size_t index, AddressRange window, const PageRunSink& sink) {
    const Mapping& mapping = mappings_[index];
    const std::uint64_t end = std::min(mapping.end, window.end);
    std::array<std::uint64_t, 4096> entries;
    for (std::uint64_t address = std::max(mapping.start, window.start); address < end;) {
        const std::uint64_t wanted = std::min<std::uint64_t>(entries.size(), (end - address) / basePage);
        const std::size_t count =
            readPagemapEntries(files_.pagemap, address, std::span(entries).first(wanted));
        if (count == 0) {
            return false;
        }
        for (std::size_t i = 0; i < count; ++i, address += basePage) {
            const std::optional<PageKind> kind =
                memoryOf(kindOfPagemapEntry(entries[i], mapping.isPrivateAnonymous()));
            if (kind) {
                sink(index, address, address + basePage, *kind);
            }
        }
    }
    return true;
}

} // namespace tally::platform
