#include "platform/linux/corpse/HeldPages.h"

#include "platform/linux/pages/PageSource.h"
#include "platform/linux/pages/PagemapEntry.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"
#include "platform/linux/pages/SmapsOfProcess.h"

#include <algorithm>
#include <cerrno>
#include <utility>

namespace tally::platform {

void HeldPages::append(std::uint64_t address, std::span<const std::uint64_t> entries) {
    if (entries.empty()) {
        return;
    }
    if (runs_.empty() || runs_.back().end != address) {
        runs_.push_back({address, address, entries_.size()});
    }
    runs_.back().end += entries.size() * basePage;
    entries_.insert(entries_.end(), entries.begin(), entries.end());
}

void HeldPages::distrustHugePages() {
    const std::uint64_t parts = basePage / sizeof(std::uint64_t); // as many as a page of entries maps
    const std::uint64_t hugePage = parts * basePage;
    for (const Run& run : runs_) {
        for (std::uint64_t at = (run.start + hugePage - 1) / hugePage * hugePage; at + hugePage <= run.end;
             at += hugePage) {
            const auto block = std::span(entries_).subspan(run.first + (at - run.start) / basePage, parts);
            const std::uint64_t frame = block[0] & pagemap::place;
            bool isHuge = frame % parts == 0;
            for (std::size_t i = 0; i < parts && isHuge; ++i) {
                isHuge = (block[i] & pagemap::present) != 0 && (block[i] & pagemap::place) == frame + i;
            }
            for (std::size_t i = 0; i < parts && isHuge; ++i) {
                block[i] &= ~pagemap::exclusive;
            }
        }
    }
}

std::vector<HeldPages::Run>::const_iterator HeldPages::runAt(std::uint64_t address) const {
    return std::upper_bound(runs_.begin(), runs_.end(), address,
                            [](std::uint64_t wanted, const Run& run) { return wanted < run.end; });
}

HeldPage HeldPages::at(std::uint64_t address) const {
    const auto run = runAt(address);
    if (run == runs_.end() || run->start > address) {
        return {};
    }
    const std::uint64_t entry = entries_[run->first + (address - run->start) / basePage];
    const std::uint64_t place = entry & pagemap::place;
    const bool isPresent = (entry & pagemap::present) != 0;
    const bool isOwn = (entry & (pagemap::present | pagemap::swapped)) != 0 && (entry & pagemap::file) == 0;
    if (!isOwn || place == 0) {
        return {};
    }
    return {isPresent ? residentKey | place : place, isPresent && (entry & pagemap::exclusive) != 0};
}

std::uint64_t HeldPages::nextHeld(std::uint64_t address) const {
    const auto run = runAt(address);
    return run == runs_.end() ? ~std::uint64_t{0} : std::max(address, run->start);
}

bool HeldPages::areFramesHidden() const {
    return !entries_.empty() && std::none_of(entries_.begin(), entries_.end(), [](std::uint64_t entry) {
        return (entry & pagemap::place) != 0;
    });
}

kern_return_t readHeldPages(MemberIdentity identity, std::span<const Mapping> mappings, HeldPages* held) {
    ProcessMemoryFiles files;
    std::vector<Mapping> listed;
    kern_return_t status = files.open(identity.pid, identity.startTicks, &listed);
    if (status != KERN_SUCCESS) {
        return status;
    }
    SmapsOfProcess smaps(files.folder);
    PageSource source(files, mappings, smaps, PageDetail::positions);
    std::vector<std::uint64_t> entries;
    const PageRunSink sink = [&](const FoundRun& run) {
        if (run.kind != PageKind::object && mappings[run.mapping].isPrivate()) {
            const std::size_t wanted = (run.end - run.start) / basePage;
            entries.resize(wanted);
            entries.resize(readPagemapEntries(files.pagemap, run.start, entries));
            status = entries.size() == wanted ? status : KERN_FAILURE;
            held->append(run.start, entries);
        }
    };
    std::size_t reached = 0;
    if (const int error = source.read(0, mappings.size(), {0, ~std::uint64_t{0}}, sink, &reached)) {
        status = error == ESRCH ? KERN_INVALID_ARGUMENT : KERN_FAILURE;
    }
    held->distrustHugePages();
    return status;
}

} // namespace tally::platform
