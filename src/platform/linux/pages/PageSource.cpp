#include "platform/linux/pages/PageSource.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/PagemapEntry.h"

#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <optional>

namespace tally::platform {

namespace {

// The kernel takes twice the time when it is asked to tell file pages from others. Private anonymous memory
// has none and shared memory nothing else, so neighbouring mappings of these with as many bytes in all are
// scanned without.
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
    const auto uniformEnd = [&](std::size_t at, std::uint64_t* bytes) {
        for (*bytes = 0; at < end && (mappings[at].isPrivateAnonymous() || mappings[at].isSharedMemory());
             ++at) {
            *bytes += sizeInside(mappings[at], window);
        }
        return at;
    };
    std::uint64_t bytes = 0;
    std::size_t at = uniformEnd(first, &bytes);
    if (bytes >= worthOwnScan) {
        return {at, false};
    }
    // Up to the next anonymous mappings that are worth a scan of their own.
    while (at < end) {
        const std::size_t next = uniformEnd(at + 1, &bytes);
        if (bytes >= worthOwnScan) {
            return {at + 1, true};
        }
        at = next;
    }
    return {end, true};
}

std::optional<PageKind> kindOfRegion(const PageRegion& region) {
    if ((region.categories & (pageIsZero | pageIsGuard)) != 0) {
        return std::nullopt; // no memory
    }
    return (region.categories & pageIsFile) != 0      ? PageKind::object
           : (region.categories & pageIsPresent) != 0 ? PageKind::anonymous
                                                      : PageKind::swapped;
}

// What a call walks without finding pages is bounded as well, because page tables that were emptied are
// walked too: by the mapped addresses, and ever less strictly while little comes, for what is only reserved
// has no tables.
constexpr std::uint64_t usualStep = 1 << 30;
constexpr std::uint64_t fewPages = 1024;
constexpr std::uint64_t growthOfEmptySteps = 64;

/// How many pages of a mapping page tables can show: what is swapped out of shared memory they do not.
std::uint64_t pagesOf(const Mapping& mapping, const SmapsEntry& entry) {
    return (entry.resident + entry.hugetlb + (mapping.shared ? 0 : entry.swapped)) / basePage;
}

/// Where, from `address` on, `bytes` of the addresses of `mappings` are passed, or their end.
std::uint64_t endOfStep(std::span<const Mapping> mappings, std::uint64_t address, std::uint64_t bytes) {
    for (const Mapping& mapping : mappings) {
        const std::uint64_t from = std::max(address, mapping.start);
        if (mapping.end > from && mapping.end - from > bytes) {
            return from + bytes;
        }
        bytes -= mapping.end > from ? mapping.end - from : 0;
    }
    return mappings.back().end;
}

} // namespace

int PageSource::read(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                     std::size_t* reached) const {
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
    if (*reached < end) {
        return readOlder(*reached, end, window, sink, reached);
    }
    if (!isAlive()) { // of an address space that went away meanwhile a scan shows a part or nothing
        *reached = first;
        return ESRCH;
    }
    return 0;
}

int PageSource::scan(std::size_t first, std::size_t end, AddressRange window, bool withFile,
                     const PageRunSink& sink, std::size_t* reached) const {
    const std::uint64_t last = std::min(window.end, mappings_[end - 1].end);
    ScanCursor cursor{.address = std::max(window.start, mappings_[first].start), .mapping = first};
    while (cursor.address < last) {
        *reached = cursor.mapping;
        if (const int error = scanOn(end, last, withFile, mostPagesOfCall, sink, &cursor); error != 0) {
            return error;
        }
    }
    *reached = end;
    return 0;
}

/// Makes one call, for pages below `last`.
int PageSource::scanOn(std::size_t end, std::uint64_t last, bool withFile, std::uint64_t mostPages,
                       const PageRunSink& sink, ScanCursor* cursor) const {
    std::size_t& mapping = cursor->mapping;
    if (cursor->address >= cursor->callEnd) {
        cursor->mostMapped = std::max(cursor->mostMapped, usualStep);
        cursor->callEnd =
            endOfStep(mappings_.subspan(mapping, end - mapping), cursor->address, cursor->mostMapped);
    }
    PageScanRoom room;
    PageScanStep step;
    const int error = scanPages(files_.pagemap.number(), {cursor->address, std::min(last, cursor->callEnd)},
                                withFile, mostPages, room, &step);
    if (error != 0) {
        return error;
    }
    cursor->mostMapped = step.pages < fewPages ? cursor->mostMapped * growthOfEmptySteps : usualStep;
    for (const PageRegion& region : step.regions) {
        // A region can reach over several mappings and what lies between them.
        while (mapping < end && mappings_[mapping].end <= region.start) {
            ++mapping;
        }
        const std::optional<PageKind> kind = memoryOf(kindOfRegion(region));
        const bool isOwn = kind == PageKind::anonymous;
        for (std::size_t at = mapping; kind && at < end && mappings_[at].start < region.end; ++at) {
            sink({at, std::max(region.start, mappings_[at].start), std::min(region.end, mappings_[at].end),
                  isOwn && mappings_[at].isSharedMemory() ? PageKind::object : *kind,
                  (region.categories & pageIsHuge) != 0});
        }
    }
    cursor->address = step.resume;
    while (mapping < end && mappings_[mapping].end <= cursor->address) {
        ++mapping;
    }
    if (mapping < end) {
        cursor->passTo(mappings_[mapping].start); // what lies between is not scanned
    }
    return 0;
}

int PageSource::readOn(std::size_t end, bool withFile, std::uint64_t mostPages, const PageRunSink& sink,
                       ScanCursor* cursor) const {
    const std::uint64_t last = mappings_[end - 1].end;
    if (scansAnswered) {
        const int error = scanOn(end, last, withFile, mostPages, sink, cursor);
        if (error != ENOTTY) {
            return error == 0 && !isAlive() ? ESRCH : error;
        }
        scansAnswered = false;
    }
    std::size_t reached = 0;
    const int error = readOlder(cursor->mapping, end, {cursor->address, last}, sink, &reached);
    cursor->passTo(last);
    return error;
}

bool PageSource::isAlive() const {
    std::uint64_t entry = 0;
    return readPagemapEntries(files_.pagemap, 0, std::span(&entry, 1)) == 1;
}

int PageSource::readOlder(std::size_t first, std::size_t end, AddressRange window, const PageRunSink& sink,
                          std::size_t* reached) const {
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
            sink({*reached, mapping.start, resident, PageKind::anonymous});
            sink({*reached, resident, std::min(resident + entry->swapped, mapping.end), PageKind::swapped});
        } else if (!readPagemap(*reached, window, pagesOf(mapping, *entry), sink)) {
            return ESRCH;
        }
    }
    return 0;
}

bool PageSource::readPagemap(std::size_t index, AddressRange window, std::uint64_t expected,
                             const PageRunSink& sink) const {
    const Mapping& mapping = mappings_[index];
    const std::uint64_t end = std::min(mapping.end, window.end);
    std::array<std::uint64_t, 4096> entries;
    // Shared memory itself tells where it has pages; nobody waits for a server there.
    const Descriptor object = mapping.isSharedMemory() && mapping.pages() > entries.size()
                                  ? openForReading(mapFilePath(files_.folder, mapping))
                                  : Descriptor();
    const bool isAnonymous = mapping.isPrivateAnonymous();
    const std::uint64_t zero = zeroFrame();
    RunJoiner runs(sink);
    for (std::uint64_t address = std::max(mapping.start, window.start); address < end && expected != 0;) {
        if (object.isOpen()) {
            const std::uint64_t offset = address - mapping.start + mapping.fileOffset;
            const off_t next = lseek(object.number(), static_cast<off_t>(offset), SEEK_DATA);
            address += next < 0 ? 0 : (static_cast<std::uint64_t>(next) - offset) / basePage * basePage;
            if (address >= end || (next < 0 && errno == ENXIO)) {
                break;
            }
        }
        const std::uint64_t wanted = std::min<std::uint64_t>(entries.size(), (end - address) / basePage);
        const std::size_t count =
            readPagemapEntries(files_.pagemap, address, std::span(entries).first(wanted));
        if (count == 0) {
            return false;
        }
        for (const std::uint64_t entry : std::span(entries).first(count)) {
            const std::optional<PageKind> kind = memoryOf(kindOfPagemapEntry(entry, isAnonymous, zero));
            if (kind) {
                runs.add(index, address, *kind);
                expected -= expected != 0 ? 1 : 0;
            }
            address += basePage;
        }
    }
    return true;
}

kern_return_t readPageStates(PageSource& source, SmapsOfProcess& smaps, std::span<const Mapping> mappings,
                             PageStates* states) {
    *states = PageStates(mappings.size());
    PageRecorder recorder(mappings, states);
    const PageRunSink sink = [&](const FoundRun& run) {
        recorder.record(run.mapping, run.start, run.end, run.kind);
    };
    const AddressRange everywhere{0, ~std::uint64_t{0}};
    for (std::size_t at = 0; at < mappings.size();) {
        const int error = source.read(at, mappings.size(), everywhere, sink, &at);
        if (error == ESRCH) {
            states->mappings.resize(at);
            return KERN_INVALID_ARGUMENT;
        }
        if (error != 0) {
            // This mapping cannot be read page by page: smaps gives the counts, at nominal places.
            MappingPages& pages = states->mappings[at] = {};
            const SmapsEntry* entry = smaps.entryFor(mappings[at]);
            pages.unreadable = entry == nullptr;
            if (entry != nullptr) {
                const std::uint64_t own = mappings[at].start + entry->anonymous;
                recorder.record(at, mappings[at].start, own, PageKind::anonymous);
                recorder.record(at, own, own + entry->resident - entry->anonymous, PageKind::object);
            }
            ++at;
        }
    }
    return KERN_SUCCESS;
}

} // namespace tally::platform
