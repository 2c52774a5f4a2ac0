#include "platform/linux/walk/Walk.h"

#include "platform/linux/gather/MachineState.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pieces/PieceBuilder.h"
#include "platform/linux/processes/ProcessStat.h"
#include "platform/linux/walk/PageSource.h"
#include "platform/linux/walk/ProcessMemoryFiles.h"
#include "platform/linux/walk/SmapsOfProcess.h"

#include <algorithm>
#include <array>

namespace tally::platform {

namespace {

/// Finds out which figures that only smaps tells the process can have at all.
WalkFacts gatherFacts(std::int32_t pid, std::uint64_t startTicks, bool objectView,
                      const std::string& folder) {
    const ProcessStatus status = decodeStatus(readSystemFile(folder + "/status").value_or(""));
    const MachineState machine = machineState();
    WalkFacts facts{
        .pid = pid, .startTicks = startTicks, .objectView = objectView, .swapInUse = machine.swapInUse};
    facts.asksLocked = status.locked != 0;
    facts.asksLazyFree = machine.lazyFree != 0 && status.residentAnonymous != 0 &&
                         decodeRollupLazyFree(readSystemFile(folder + "/smaps_rollup").value_or("")) != 0;
    return facts;
}

constexpr const char* estimateNotice =
    "The page cache could not be asked: shared memory and files are counted by the process's own page tables";

} // namespace

Walk::Result Walk::read(std::int32_t pid, std::uint64_t startTicks, bool objectView) {
    auto walk = std::make_unique<Walk>();
    ProcessMemoryFiles files;
    Result result;
    result.status = files.open(pid, startTicks, &walk->mappings_);
    if (result.status != KERN_SUCCESS) {
        return result;
    }
    const WalkFacts facts = gatherFacts(pid, startTicks, objectView, files.folder);
    SmapsOfProcess smaps(files);
    PageStates states;
    PageSource source(files, walk->mappings_, smaps, PageDetail::counts);
    const kern_return_t status = readPageStates(source, smaps, walk->mappings_, &states);
    if (status != KERN_SUCCESS) {
        walk->statusPastEnd_ = status;
        walk->mappings_.resize(states.mappings.size());
    }
    PieceBuilder builder(facts, walk->mappings_, states, files.folder, smaps);
    for (std::size_t i = 0; i < states.mappings.size(); ++i) {
        if (states.mappings[i].unreadable) {
            walk->statusPastEnd_ = KERN_FAILURE;
            break;
        }
        builder.build(i);
    }
    walk->pieces_ = builder.takePieces();
    walk->words_ = builder.takeWords();
    if (builder.usedEstimates()) {
        result.notices.emplace_back(estimateNotice);
    }
    result.walk = std::move(walk);
    return result;
}

const Piece* Walk::pieceAt(std::uint64_t address) const {
    const auto found =
        std::upper_bound(pieces_.begin(), pieces_.end(), address,
                         [](std::uint64_t at, const Piece& piece) { return at < piece.end(); });
    return found == pieces_.end() ? nullptr : &*found;
}

void Walk::pageWords(std::uint64_t address, std::span<std::int32_t> words) const {
    std::fill(words.begin(), words.end(), 0);
    const std::uint64_t end = address + words.size() * basePage;
    for (const Piece* piece = pieceAt(address); piece != pieces_.data() + pieces_.size() && piece != nullptr;
         ++piece) {
        if (piece->start >= end) {
            break;
        }
        const std::uint64_t from = std::max(address, piece->start);
        const std::uint64_t to = std::min(end, piece->end());
        pageWordsOf(*piece, (from - piece->start) / basePage,
                    words.subspan((from - address) / basePage, (to - from) / basePage));
    }
}

void Walk::pageWordsOf(const Piece& piece, std::uint64_t firstPage, std::span<std::int32_t> words) const {
    const std::int32_t external = piece.externalPager ? VM_PAGE_QUERY_PAGE_EXTERNAL : 0;
    const std::uint32_t clean = piece.resident - piece.dirty - piece.reusable;
    const std::array<PageWords, 4> byCounts{{
        {0, piece.dirty, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY | external},
        {piece.dirty, clean, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL},
        {piece.dirty + clean, piece.reusable, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_REUSABLE},
        {piece.resident, piece.swapped, VM_PAGE_QUERY_PAGE_PAGED_OUT},
    }};
    const std::span<const PageWords> known =
        piece.wordsCount == 0 ? std::span<const PageWords>(byCounts)
                              : std::span(words_).subspan(piece.firstWords, piece.wordsCount);
    auto at =
        std::upper_bound(known.begin(), known.end(), firstPage, [](std::uint64_t page, const PageWords& run) {
            return page < std::uint64_t{run.firstPage} + run.pages;
        });
    const std::uint64_t endPage = firstPage + words.size();
    for (; at != known.end() && at->firstPage < endPage; ++at) {
        const std::uint64_t from = std::max<std::uint64_t>(at->firstPage, firstPage);
        const std::uint64_t to = std::min(std::uint64_t{at->firstPage} + at->pages, endPage);
        std::fill(words.begin() + static_cast<std::ptrdiff_t>(from - firstPage),
                  words.begin() + static_cast<std::ptrdiff_t>(std::max(to, from) - firstPage), at->word);
    }
}

} // namespace tally::platform
