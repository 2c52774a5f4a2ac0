#include "platform/linux/walk/SmapsPages.h"

#include "platform/linux/io/SystemFiles.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <optional>
#include <string>

namespace tally::platform {

namespace {

// Bits of a pagemap entry.
constexpr std::uint64_t EntryPresent = std::uint64_t{1} << 63;
constexpr std::uint64_t EntrySwapped = std::uint64_t{1} << 62;
constexpr std::uint64_t EntryFile = std::uint64_t{1} << 61;
constexpr std::uint64_t EntryGuard = std::uint64_t{1} << 58;

std::optional<PageKind> kindOfEntry(std::uint64_t entry) {
    if ((entry & EntryGuard) != 0 || (entry & (EntryPresent | EntrySwapped)) == 0) {
        return std::nullopt;
    }
    return (entry & EntryFile) != 0      ? PageKind::object
           : (entry & EntryPresent) != 0 ? PageKind::anonymous
                                         : PageKind::swapped;
}

/// Reads the runs of one mapping. @return false when pagemap gives nothing for it.
bool readRuns(const Descriptor& pagemap, const Mapping& mapping, std::size_t index, PageRecorder& recorder) {
    std::array<std::uint64_t, 4096> entries;
    for (std::uint64_t address = mapping.start; address < mapping.end;) {
        const std::uint64_t wanted =
            std::min<std::uint64_t>(entries.size(), (mapping.end - address) / basePage);
        const ssize_t bytes = pread(pagemap.number(), entries.data(), wanted * sizeof(std::uint64_t),
                                    static_cast<off_t>(address / basePage * sizeof(std::uint64_t)));
        if (bytes <= 0) {
            return false;
        }
        const std::size_t count = static_cast<std::size_t>(bytes) / sizeof(std::uint64_t);
        for (std::size_t i = 0; i < count; ++i, address += basePage) {
            if (const std::optional<PageKind> kind = kindOfEntry(entries[i])) {
                recorder.record(index, address, address + basePage, *kind);
            }
        }
    }
    return true;
}

} // namespace

bool SmapsOfProcess::isReadable() {
    if (!entries_) {
        entries_ = decodeSmaps(readSystemFile(files_->folder + "/smaps").value_or(""));
    }
    return !entries_->empty();
}

const SmapsEntry* SmapsOfProcess::entryFor(const Mapping& mapping) {
    if (!isReadable()) {
        return nullptr;
    }
    const auto found = std::lower_bound(
        entries_->begin(), entries_->end(), mapping.start,
        [](const SmapsEntry& entry, std::uint64_t start) { return entry.mapping.start < start; });
    return found != entries_->end() && found->mapping.start == mapping.start ? &*found : nullptr;
}

kern_return_t readPagesBySmaps(const ProcessMemoryFiles& files, std::span<const Mapping> mappings,
                               SmapsOfProcess& smaps, PageStates* states) {
    if (!smaps.isReadable()) {
        states->mappings.clear();
        return KERN_INVALID_ARGUMENT;
    }
    PageRecorder recorder(mappings, states);
    for (std::size_t i = 0; i < mappings.size(); ++i) {
        MappingPages& pages = states->mappings[i];
        const SmapsEntry* entry = smaps.entryFor(mappings[i]);
        if (!pages.unreadable && (pages.object != 0 || pages.own() != 0)) {
            continue;
        }
        pages.unreadable = false; // a mapping that smaps does not list has been unmapped meanwhile
        if (entry == nullptr || entry->resident + entry->swapped + entry->hugetlb == 0) {
            continue;
        }
        if (mappings[i].isPrivateAnonymous()) {
            pages.anonymous = entry->resident / basePage;
            pages.swapped = entry->swapped / basePage;
        } else if (!readRuns(files.pagemap, mappings[i], i, recorder)) {
            pages.unreadable = true;
        }
    }
    return KERN_SUCCESS;
}

} // namespace tally::platform
