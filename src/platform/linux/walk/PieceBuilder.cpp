#include "platform/linux/walk/PieceBuilder.h"

#include "platform/linux/objects/ObjectId.h"
#include "platform/linux/tags/Tags.h"
#include "platform/linux/walk/SharedPieces.h"

#include <algorithm>

namespace tally::platform {

namespace {

std::vector<BackingObject> backingsOf(const AddressSpace& space) {
    std::vector<BackingObject> backings;
    backings.reserve(space.mappings.size());
    for (const Mapping& mapping : space.mappings) {
        backings.push_back(backingOf(mapping, space.folder));
    }
    return backings;
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

PieceBuilder::PieceBuilder(const WalkFacts& facts, const AddressSpace& space, SmapsOfProcess& smaps)
    : facts_(facts), mappings_(space.mappings), states_(space.states), parts_(space.parts), smaps_(smaps),
      backings_(backingsOf(space)), tags_(tagsOf(space.folder, mappings_, backings_, states_)),
      objects_(space, backings_, facts.swapInUse, smaps) {
    pieces_.reserve(mappings_.size());
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

void PieceBuilder::addObjectPiece(std::size_t index, const ObjectPages& pages, std::uint64_t length) {
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
    piece.objectId = pages.id;
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
        piece.resident = facts_.view == View::object ? 0 : static_cast<std::uint32_t>(states.object);
    } else if (backing.backing == Backing::anonymous) {
        addOwnPiece(index, states, restIsApart ? states.own() : mapping.pages());
    } else {
        DividedObject object = facts_.view == View::object ? objects_.seen(index) : objects_.charged(index);
        if (restIsApart || states.own() != 0) { // the task's own pages stand between them
            pack(object.others.words);
            pack(object.marked.words);
        }
        const std::uint64_t room = mapping.pages() - states.own();
        const std::uint64_t heldOfOthers = std::min(object.others.held(), room);
        const std::uint64_t marked =
            object.marked.held() == 0 ? 0 : std::min(object.markedRoom, room - heldOfOthers);
        // The object's piece takes what is untouched, and without one the task's own.
        const bool packed = restIsApart || object.restIsApart;
        const std::uint64_t others = packed || heldOfOthers == 0 ? heldOfOthers : room - marked;
        addObjectPiece(index, object.others, others);
        addObjectPiece(index, object.marked, marked);
        addOwnPiece(index, states, packed || others != 0 ? states.own() : mapping.pages() - marked);
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

ResidentMemory PieceBuilder::residentMemory() const {
    ResidentMemory sum;
    for (std::size_t i = 0; i < states_.mappings.size(); ++i) {
        const MappingPages& pages = states_.mappings[i];
        sum.anonymous += pages.anonymous * basePage;
        sum.shared += backings_[i].backing == Backing::sharedMemory ? pages.object * basePage : 0;
        sum.swapped += pages.swapped * basePage;
    }
    return sum;
}

} // namespace tally::platform
