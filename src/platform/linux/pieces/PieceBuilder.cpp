#include "platform/linux/pieces/PieceBuilder.h"

#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/pieces/FindPages.h"
#include "platform/linux/pieces/SharedPieces.h"
#include "platform/linux/tags/Tags.h"

#include <algorithm>
#include <optional>

namespace tally::platform {

namespace {

constexpr std::int32_t cleanFilePage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
constexpr std::int32_t dirtyFilePage = cleanFilePage | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr std::int32_t sharedMemoryPage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;

/// Whether its pages are the only copy, so that the kernel can drop none of them.
bool isOnlyCopy(const BackingObject& object) {
    return object.backing == Backing::sharedMemory || object.backing == Backing::hugetlb ||
           object.backing == Backing::device;
}

std::uint64_t filePage(const Mapping& mapping) { return mapping.fileOffset / basePage; }

PageWords wordsOf(PageRange range, std::uint64_t base, std::int32_t word) {
    return {range.first - base, static_cast<std::uint32_t>(range.pages()), word};
}

/// The pages of `range` that no run covers.
void appendGaps(std::span<const PageRun> runs, PageRange range, std::vector<PageRange>* gaps) {
    for (const PageRun& run : runs) {
        if (range.first < run.firstPage) {
            gaps->push_back({range.first, run.firstPage});
        }
        range.first = run.endPage();
    }
    if (range.first < range.end) {
        gaps->push_back(range);
    }
}

/// Takes the first `count` pages of `ranges`: where only a number is known.
std::vector<PageRange> firstPages(std::span<const PageRange> ranges, std::uint64_t count) {
    std::vector<PageRange> taken;
    for (const PageRange& range : ranges) {
        const std::uint64_t pages = std::min(count, range.pages());
        if (pages == 0) {
            break;
        }
        taken.push_back({range.first, range.first + pages});
        count -= pages;
    }
    return taken;
}

/// Moves the words of an object's pages to where they stand once the task's own pages are taken out.
void closeGaps(std::span<const PageRun> runs, std::vector<PageWords>& words) {
    std::uint64_t ownBelow = 0;
    std::size_t at = 0;
    for (PageWords& word : words) {
        for (; at < runs.size() && runs[at].firstPage < word.firstPage; ++at) {
            ownBelow += runs[at].kind == PageKind::object ? 0 : runs[at].pages;
        }
        word.firstPage -= ownBelow;
    }
}

/// Moves the words together, one behind the other.
void pack(std::vector<PageWords>& words) {
    std::uint64_t next = 0;
    for (PageWords& word : words) {
        word.firstPage = next;
        next += word.pages;
    }
}

} // namespace

struct PieceBuilder::ObjectPages {
    std::uint64_t offset = 0; // bytes in the object
    std::uint64_t resident = 0;
    std::uint64_t dirty = 0;
    std::uint64_t swapped = 0;
    std::vector<PageWords> words; // by page of the mapping; empty when the counts say enough
    bool restIsApart = false;     // what is not there is a piece of its own

    std::uint64_t held() const { return resident + swapped; }
};

PieceBuilder::PieceBuilder(const WalkFacts& facts, const AddressSpace& space, SmapsOfProcess& smaps)
    : facts_(facts), mappings_(space.mappings), states_(space.states), parts_(space.parts),
      folder_(space.folder), smaps_(smaps) {
    backings_.reserve(mappings_.size());
    pieces_.reserve(mappings_.size());
    for (const Mapping& mapping : mappings_) {
        backings_.push_back(backingOf(mapping, folder_));
        if (mapping.isFileBacked() && !facts.objectView) {
            const std::uint64_t first = filePage(mapping);
            counted_.expect(objectIdOfFile(backings_.back()), {first, first + mapping.pages()});
        }
    }
    counted_.prepare();
    tags_ = tagsOf(folder_, mappings_, backings_, states_);
}

PieceBuilder::ObjectPages PieceBuilder::chargedObjectPages(std::size_t index) {
    const Mapping& mapping = mappings_[index];
    const BackingObject& backing = backings_[index];
    const std::uint64_t id = objectIdOfFile(backing);
    const std::uint64_t base = filePage(mapping);
    ObjectPages pages;
    pages.offset = mapping.fileOffset;
    std::vector<PageRange> fresh;
    for (const PageRun& run : states_.runsOf(states_.mappings[index])) {
        if (run.kind == PageKind::object) {
            counted_.take(id, {base + run.firstPage, base + run.endPage()}, &fresh);
        }
    }
    const std::int32_t word = isOnlyCopy(backing) ? sharedMemoryPage : cleanFilePage;
    for (const PageRange& range : fresh) {
        pages.resident += range.pages();
        pages.words.push_back(wordsOf(range, base, word));
    }
    if (isOnlyCopy(backing)) {
        pages.dirty = pages.resident;
        if (facts_.swapInUse && backing.backing == Backing::sharedMemory) {
            markSwapped(index, openForPageStates(folder_, mapping), pages);
        }
    } else if (backing.backing == Backing::file && mapping.shared && mapping.writable &&
               pages.resident != 0) {
        markDirty(index, pages);
    }
    return pages;
}

/// Adds the pages of shared memory that are swapped out: no page table shows them.
void PieceBuilder::markSwapped(std::size_t index, const Descriptor& file, ObjectPages& pages) {
    const Mapping& mapping = mappings_[index];
    const MappingPages& states = states_.mappings[index];
    const std::uint64_t base = filePage(mapping);
    std::vector<PageRange> gaps;
    appendGaps(states_.runsOf(states), {0, mapping.pages()}, &gaps);
    PageFinder finder(file, &CachedPages::evicted);
    std::vector<PageRange> swapped;
    bool asked = file.isOpen();
    for (const PageRange& gap : gaps) {
        asked = asked && finder.find({base + gap.first, base + gap.end}, &swapped);
    }
    if (!asked) {
        const SmapsEntry* entry = smaps_.entryFor(mapping);
        const std::uint64_t count = entry == nullptr ? 0 : entry->swapped / basePage;
        swapped = firstPages(gaps, count - std::min(count, states.swapped));
        for (PageRange& range : swapped) {
            range = {base + range.first, base + range.end};
        }
    }
    std::vector<PageRange> fresh;
    for (const PageRange& range : swapped) {
        counted_.take(objectIdOfFile(backings_[index]), range, &fresh);
    }
    for (const PageRange& range : fresh) {
        pages.swapped += range.pages();
        pages.words.push_back(wordsOf(range, base, VM_PAGE_QUERY_PAGE_PAGED_OUT));
    }
    std::sort(pages.words.begin(), pages.words.end(),
              [](const PageWords& a, const PageWords& b) { return a.firstPage < b.firstPage; });
}

/// Tells the dirty pages of a file that the task can write from the clean ones.
void PieceBuilder::markDirty(std::size_t index, ObjectPages& pages) {
    const Mapping& mapping = mappings_[index];
    const std::uint64_t base = filePage(mapping);
    const Descriptor file = openForPageStates(folder_, mapping);
    PageFinder finder(file, &CachedPages::dirty);
    std::vector<PageRange> resident;
    std::vector<PageRange> dirty;
    bool asked = file.isOpen();
    for (const PageWords& word : pages.words) {
        resident.push_back({base + word.firstPage, base + word.firstPage + word.pages});
        asked = asked && finder.find(resident.back(), &dirty);
    }
    if (!asked) {
        const SmapsEntry* entry = smaps_.entryFor(mapping);
        const std::uint64_t count = entry == nullptr ? 0 : entry->dirty / basePage;
        dirty = firstPages(resident, count);
        usedEstimates_ |= count != 0 && count < pages.resident; // how many, but not which
    }
    std::vector<PageWords> words;
    std::size_t at = 0;
    for (PageRange range : resident) {
        for (; at < dirty.size() && dirty[at].first < range.end; ++at) {
            if (range.first < dirty[at].first) {
                words.push_back(wordsOf({range.first, dirty[at].first}, base, cleanFilePage));
            }
            words.push_back(wordsOf(dirty[at], base, dirtyFilePage));
            pages.dirty += dirty[at].pages();
            range.first = dirty[at].end;
        }
        if (range.first < range.end) {
            words.push_back(wordsOf(range, base, cleanFilePage));
        }
    }
    pages.words = std::move(words);
}

/// The pages of the object in the mapped range, whoever brought them there.
PieceBuilder::ObjectPages PieceBuilder::seenObjectPages(std::size_t index) {
    const Mapping& mapping = mappings_[index];
    const BackingObject& backing = backings_[index];
    if (backing.backing == Backing::sharedMemory || backing.backing == Backing::file) {
        const Descriptor file = openForPageStates(folder_, mapping);
        const std::optional<CachedPages> inside = cachedPages(file, mapping.fileOffset, mapping.size());
        const std::optional<CachedPages> below = cachedPages(file, 0, mapping.fileOffset);
        if (inside && below) {
            ObjectPages pages;
            pages.resident = inside->cached;
            if (backing.backing == Backing::file) {
                pages.offset = mapping.fileOffset;
                pages.dirty = inside->dirty;
            } else {
                // Whoever maps the range finds the same pages: numbered through the object, they merge
                // exactly.
                pages.offset = (below->cached + (facts_.swapInUse ? below->evicted : 0)) * basePage;
                pages.dirty = inside->cached;
                pages.swapped = facts_.swapInUse ? inside->evicted : 0;
                pages.restIsApart = true;
            }
            return pages;
        }
        usedEstimates_ = true;
    }
    return chargedObjectPages(index);
}

Piece& PieceBuilder::addPiece(std::size_t index, std::uint64_t length) {
    const Mapping& mapping = mappings_[index];
    Piece piece;
    piece.start = nextStart_;
    piece.size = length * basePage;
    piece.protection = (mapping.readable ? 1 : 0) | (mapping.writable ? 2 : 0) | (mapping.executable ? 4 : 0);
    piece.tag = tags_[index];
    piece.externalPager = backings_[index].hasName;
    piece.mapping = index;
    nextStart_ += piece.size;
    return pieces_.emplace_back(piece);
}

/// The piece that nothing stands behind.
void PieceBuilder::addRest(std::size_t index, std::uint64_t length) {
    if (length != 0) {
        addPiece(index, length);
    }
}

void PieceBuilder::addObjectPiece(std::size_t index, ObjectPages pages, std::uint64_t length) {
    if (length == 0) {
        return;
    }
    Piece& piece = addPiece(index, length);
    piece.offset = pages.offset;
    // A page that the task has a copy of can stand in the object too, and then finds no room in this piece.
    piece.resident = static_cast<std::uint32_t>(std::min(pages.resident, length));
    piece.dirty = static_cast<std::uint32_t>(std::min<std::uint64_t>(pages.dirty, piece.resident));
    piece.swapped = static_cast<std::uint32_t>(std::min(pages.swapped, length - piece.resident));
    if (piece.resident + piece.swapped == 0) {
        return;
    }
    piece.objectId = objectIdOfFile(backings_[index]);
    piece.shareMode = mappings_[index].shared ? SM_SHARED : SM_COW;
    const bool uniform = pages.words.size() == 1 && pages.words[0].pages == length;
    if (!uniform) {
        piece.firstWords = words_.size();
        piece.wordsCount = pages.words.size();
        words_.insert(words_.end(), pages.words.begin(), pages.words.end());
    }
}

std::span<const SharedPart> PieceBuilder::partsOf(std::size_t index) {
    std::size_t count = 0;
    while (count < parts_.size() && parts_[count].mapping == index) {
        ++count;
    }
    const std::span<const SharedPart> parts = parts_.first(count);
    parts_ = parts_.subspan(count);
    return parts;
}

/// The task's pages, whoever of its relatives has them too.
void PieceBuilder::addOwnPiece(std::size_t index, const MappingPages& own, std::uint64_t length) {
    if (length == 0) {
        return;
    }
    Piece& piece = addPiece(index, length);
    piece.resident = static_cast<std::uint32_t>(own.anonymous);
    piece.swapped = static_cast<std::uint32_t>(own.swapped);
    piece.dirty = piece.resident;
    if (own.own() != 0) {
        piece.objectId =
            objectIdOfTaskMemory(facts_.owner.pid, facts_.owner.startTicks, mappings_[index].start);
        piece.shareMode = SM_PRIVATE;
    }
}

void PieceBuilder::markLazilyFreed(std::size_t index, Piece& own) {
    const SmapsEntry* entry = smaps_.entryFor(mappings_[index]);
    const std::uint64_t pages = entry == nullptr ? 0 : entry->lazyFree / basePage;
    own.reusable = static_cast<std::uint32_t>(std::min<std::uint64_t>(pages, own.dirty));
    own.dirty -= own.reusable;
}

void PieceBuilder::build(std::size_t index) {
    const Mapping& mapping = mappings_[index];
    const BackingObject& backing = backings_[index];
    const MappingPages& states = states_.mappings[index];
    const std::span<const SharedPart> parts = partsOf(index);
    const std::size_t firstPiece = pieces_.size();
    nextStart_ = mapping.start;

    const SmapsEntry* entry = facts_.asksLocked ? smaps_.entryFor(mapping) : nullptr;
    const bool wired = backing.backing == Backing::hugetlb || (entry != nullptr && entry->locked);
    const bool restIsApart = wired && !mapping.shared;

    if (backing.backing == Backing::special) {
        // The kernel's pages: part of the task's resident memory, but of no object that could be told from
        // others.
        Piece& piece = addPiece(index, mapping.pages());
        piece.resident = facts_.objectView ? 0 : static_cast<std::uint32_t>(states.object);
    } else if (backing.backing == Backing::anonymous) {
        addOwnPiece(index, states, restIsApart ? states.own() : mapping.pages());
    } else {
        ObjectPages object = facts_.objectView ? seenObjectPages(index) : chargedObjectPages(index);
        const std::uint64_t room = mapping.pages() - states.own();
        const bool packed = restIsApart || object.restIsApart;
        // The object's piece takes what is untouched, and without one the task's own.
        const std::uint64_t objectLength = packed ? std::min(object.held(), room)
                                           : states.own() != 0 && object.held() == 0 ? 0
                                                                                     : room;
        if (packed && restIsApart) {
            pack(object.words);
        } else if (states.own() != 0) {
            closeGaps(states_.runsOf(states), object.words);
        }
        addObjectPiece(index, std::move(object), objectLength);
        addOwnPiece(index, states, packed || objectLength != 0 ? states.own() : mapping.pages());
    }
    if (facts_.asksLazyFree && states.anonymous != 0) {
        markLazilyFreed(index, pieces_.back());
    }
    for (std::size_t i = firstPiece; i < pieces_.size(); ++i) {
        pieces_[i].isWired = wired && pieces_[i].resident + pieces_[i].swapped != 0;
    }
    if (!parts.empty()) {
        const Piece own = pieces_.back();
        pieces_.pop_back();
        appendDivided(own, parts, &pieces_);
    }
    addRest(index, (mapping.end - nextStart_) / basePage);
}

} // namespace tally::platform
