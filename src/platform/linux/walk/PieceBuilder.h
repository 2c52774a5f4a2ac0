// PieceBuilder: from the mappings of one task and the states of their pages to the pieces that the walk
// reports.
//
// Decides what each mapping counts: as charged to the task, or as the VM objects see it. One builder serves
// one walk, mapping after mapping in rising order.

#pragma once

#include "platform/View.h"
#include "platform/linux/families/FamilyScan.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/pages/PageStates.h"
#include "platform/linux/pages/SmapsOfProcess.h"
#include "platform/linux/walk/ObjectCounter.h"
#include "platform/linux/walk/Piece.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

/// What holds for all mappings of a walk.
struct WalkFacts {
    MemberIdentity owner; // who stands for the address space
    View view = View::charged;
    bool swapInUse = false;
    bool asksLazyFree = false; // smaps must be asked for lazily freed pages
    bool asksLocked = false;   // and for locked mappings
};

class PieceBuilder {
  public:
    PieceBuilder(const WalkFacts& facts, const AddressSpace& space, SmapsOfProcess& smaps);

    /// Appends the pieces of mapping `index`.
    void build(std::size_t index);

    std::vector<Piece> takePieces() { return std::move(pieces_); }
    std::vector<PageWords> takeWords() { return std::move(words_); }
    ResidentMemory residentMemory() const;
    /// As ObjectCounter says.
    bool usedEstimates() const { return objects_.usedEstimates(); }

  private:
    void addObjectPiece(std::size_t index, const ObjectPages& pages, std::uint64_t length);
    void addOwnPiece(std::size_t index, const MappingPages& own, std::uint64_t length);
    void markLazilyFreed(std::size_t index, Piece& own);
    std::span<const SharedPart> partsOf(std::size_t index);
    void addRest(std::size_t index, std::uint64_t length);
    Piece& addPiece(std::size_t index, std::uint64_t length);

    const WalkFacts& facts_;
    std::span<const Mapping> mappings_;
    const PageStates& states_;
    std::span<const SharedPart> parts_; // not built yet
    SmapsOfProcess& smaps_;
    std::vector<BackingObject> backings_;
    std::vector<std::uint32_t> tags_; // by mapping
    ObjectCounter objects_;
    std::vector<Piece> pieces_;
    std::vector<PageWords> words_;
    std::uint64_t nextStart_ = 0; // of the next piece in the mapping that is being built
};

} // namespace tally::platform
