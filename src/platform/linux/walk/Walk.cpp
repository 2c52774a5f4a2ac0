#include "platform/linux/walk/Walk.h"

#include "platform/linux/families/Families.h"
#include "platform/linux/io/MachineNotices.h"
#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/machine/MachineState.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/pages/PageSource.h"
#include "platform/linux/pages/ProcessMemoryFiles.h"
#include "platform/linux/pages/SmapsOfProcess.h"
#include "platform/linux/walk/LazyFree.h"
#include "platform/linux/walk/PieceBuilder.h"
#include "platform/linux/walk/SharedPieces.h"

#include <algorithm>
#include <array>

namespace tally::platform {

namespace {

/// Finds out which figures that only smaps tells the process can have at all.
WalkFacts gatherFacts(MemberIdentity task, MemberIdentity owner, View view, const std::string& folder,
                      std::optional<ProcessStatus> known) {
    const MachineState machine = machineState();
    WalkFacts facts{.owner = owner, .view = view, .swapInUse = machine.swapInUse};
    if (!known) {
        const std::optional<std::string> text = readSystemRecord(folder + "/status");
        known = text ? std::optional(decodeStatus(*text)) : std::nullopt;
    }
    facts.asksLocked = !known || known->locked != 0;
    facts.asksLazyFree = hasLazilyFreedMemory(task.pid, folder);
    return facts;
}

AddressSpace readAlone(MemberIdentity task) {
    AddressSpace space;
    ProcessMemoryFiles files;
    space.status = files.open(task.pid, task.startTicks, &space.mappings);
    space.folder = files.folder;
    if (space.status == KERN_SUCCESS) {
        SmapsOfProcess smaps(files.folder);
        PageSource source(files, space.mappings, smaps, PageDetail::counts);
        space.status = readPageStates(source, smaps, space.mappings, &space.states);
    }
    return space;
}

bool hasNothing(const AddressSpace& space) {
    return space.status != KERN_SUCCESS && space.states.mappings.empty();
}

/// Whether the kernel has merged pages of the process with others of the same content.
bool hasMergedPages(const std::string& folder) {
    const std::string text = readSystemRecord(folder + "/ksm_merging_pages").value_or("");
    std::string_view rest = text;
    std::uint64_t pages = 0;
    return takeNumber(rest, &pages) && pages != 0;
}

constexpr const char* mergedPagesNotice =
    "Pages that the kernel has merged by their content (KSM) count for every process that has them";
constexpr const char* missedSmapsNotice =
    "Its smaps could not be read: lazily freed memory counts as dirty, and none as locked";
constexpr const char* unreadRelativesNotice =
    "What is shared with forked relatives counts for each of them: they could not be read side by side";

} // namespace

Walk::Result Walk::read(MemberIdentity task, const FamilyKey& key, MemberIdentity owner, View view,
                        std::optional<ProcessStatus> known) {
    Result result;
    const NoteTaker taker(result.notices);
    std::optional<AddressSpace> withRelatives = takeFamilySpace(key, owner);
    AddressSpace space = withRelatives ? std::move(*withRelatives) : readAlone(task);
    if (hasNothing(space) || (withRelatives && space.status == KERN_FAILURE)) {
        space = readAlone(task); // it may have been loading a program
        if (hasNothing(space)) {
            result.status = space.status;
            return result;
        }
        if (withRelatives) {
            result.notices.emplace_back(unreadRelativesNotice);
        }
    }
    auto walk = std::make_unique<Walk>();
    if (space.status != KERN_SUCCESS) {
        walk->statusPastEnd_ = space.status;
        space.mappings.resize(space.states.mappings.size());
    }
    const WalkFacts facts = gatherFacts(task, owner, view, space.folder, known);
    SmapsOfProcess smaps(space.folder);
    PieceBuilder builder(facts, space, smaps);
    for (std::size_t i = 0; i < space.mappings.size(); ++i) {
        if (space.states.mappings[i].unreadable) {
            walk->statusPastEnd_ = KERN_FAILURE;
            break;
        }
        builder.build(i);
    }
    walk->resident_ = builder.residentMemory();
    walk->pieces_ = builder.takePieces();
    walk->words_ = builder.takeWords();
    if (const MachineState machine = machineState(); machine.mergesPages && !machine.tellsMergedPages) {
        result.notices.emplace_back(untoldMergingNotice);
    } else if (machine.mergesPages && hasMergedPages(space.folder)) {
        result.notices.emplace_back(mergedPagesNotice);
    }
    if (smaps.wasMissed()) {
        result.notices.emplace_back(missedSmapsNotice);
    }
    if (builder.usedEstimates()) {
        result.notices.emplace_back(pageCacheNotice);
    }
    if (space.isEstimated && !space.parts.empty()) {
        result.notices.emplace_back(sharingNotice);
    }
    walk->folder_ = std::move(space.folder);
    walk->mappings_ = std::move(space.mappings);
    result.walk = std::move(walk);
    return result;
}

void Walk::divide(std::span<const SharedPart> parts) {
    std::vector<Piece> divided;
    divided.reserve(pieces_.size() + parts.size());
    for (const Piece& piece : pieces_) {
        std::size_t count = 0;
        while (piece.shareMode == SM_PRIVATE && count < parts.size() &&
               parts[count].mapping == piece.mapping) {
            ++count;
        }
        if (count == 0) {
            divided.push_back(piece);
        } else {
            appendDivided(piece, parts.first(count), &divided);
            parts = parts.subspan(count);
        }
    }
    pieces_ = std::move(divided);
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

std::uint64_t Walk::nextPage(std::uint64_t address, std::uint64_t end) const {
    std::array<PageWords, 4> byCounts;
    for (const Piece* piece = pieceAt(address); piece != nullptr && piece != pieces_.data() + pieces_.size();
         ++piece) {
        for (const PageWords& run : wordsOf(*piece, byCounts)) {
            const std::uint64_t runEnd = piece->start + (run.firstPage + run.pages) * basePage;
            if (run.pages != 0 && runEnd > address) {
                return std::min(end, std::max(address, piece->start + run.firstPage * basePage));
            }
        }
        if (piece->end() >= end) {
            break;
        }
    }
    return end;
}

std::span<const PageWords> Walk::wordsOf(const Piece& piece, std::array<PageWords, 4>& byCounts) const {
    const std::int32_t external = piece.externalPager ? VM_PAGE_QUERY_PAGE_EXTERNAL : 0;
    const std::uint32_t clean = piece.resident - piece.dirty - piece.reusable;
    byCounts = {{
        {0, piece.dirty, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY | external},
        {piece.dirty, clean, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL},
        {piece.dirty + clean, piece.reusable, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_REUSABLE},
        {piece.resident, piece.swapped, VM_PAGE_QUERY_PAGE_PAGED_OUT},
    }};
    return piece.wordsCount == 0 ? std::span<const PageWords>(byCounts)
                                 : std::span(words_).subspan(piece.firstWords, piece.wordsCount);
}

void Walk::pageWordsOf(const Piece& piece, std::uint64_t firstPage, std::span<std::int32_t> words) const {
    std::array<PageWords, 4> byCounts;
    const std::span<const PageWords> known = wordsOf(piece, byCounts);
    auto at =
        std::upper_bound(known.begin(), known.end(), firstPage, [](std::uint64_t page, const PageWords& run) {
            return page < run.firstPage + run.pages;
        });
    const std::uint64_t endPage = firstPage + words.size();
    for (; at != known.end() && at->firstPage < endPage; ++at) {
        const std::uint64_t from = std::max(at->firstPage, firstPage);
        const std::uint64_t to = std::min(at->firstPage + at->pages, endPage);
        std::fill(words.begin() + static_cast<std::ptrdiff_t>(from - firstPage),
                  words.begin() + static_cast<std::ptrdiff_t>(std::max(to, from) - firstPage), at->word);
    }
}

} // namespace tally::platform
