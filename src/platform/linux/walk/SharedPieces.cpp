#include "platform/linux/walk/SharedPieces.h"

#include "platform/linux/pages/Mapping.h"

#include <algorithm>

namespace tally::platform {

void appendDivided(const Piece& own, std::span<const SharedPart> parts, std::vector<Piece>* pieces) {
    const std::size_t first = pieces->size();
    Piece rest = own;
    for (const SharedPart& part : parts) {
        Piece shared = own;
        shared.start = rest.start;
        shared.offset = part.pagesBelow * basePage;
        shared.objectId = part.objectId;
        shared.resident = static_cast<std::uint32_t>(std::min<std::uint64_t>(part.resident, rest.resident));
        shared.swapped = static_cast<std::uint32_t>(std::min<std::uint64_t>(part.swapped, rest.swapped));
        shared.size = (std::uint64_t{shared.resident} + shared.swapped) * basePage;
        shared.shareMode = SM_COW;
        rest.start += shared.size;
        rest.size -= shared.size;
        rest.resident -= shared.resident;
        rest.swapped -= shared.swapped;
        pieces->push_back(shared);
    }
    if (rest.resident + rest.swapped == 0) {
        rest.objectId = 0;
        rest.shareMode = SM_EMPTY;
        rest.isWired = false;
    }
    if (rest.size != 0) {
        pieces->push_back(rest);
    }
    // Lazily freed pages are told by mapping only: they are taken to be the task's own first.
    std::uint32_t reusable = own.reusable;
    for (std::size_t i = pieces->size(); i-- > first;) {
        Piece& piece = (*pieces)[i];
        piece.reusable = std::min(reusable, piece.resident);
        piece.dirty = piece.resident - piece.reusable;
        reusable -= piece.reusable;
    }
}

} // namespace tally::platform
