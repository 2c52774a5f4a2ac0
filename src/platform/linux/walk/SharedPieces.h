// The task's own piece of a mapping, divided by who holds its pages.

#pragma once

#include "platform/linux/families/SharedParts.h"
#include "platform/linux/walk/Piece.h"

#include <span>
#include <vector>

namespace tally::platform {

/// Appends the pieces that `own`, which holds all pages of a mapping that are not its file's, becomes once it
/// is known which of them the task shares with relatives: a piece per part, then what is left for itself.
void appendDivided(const Piece& own, std::span<const SharedPart> parts, std::vector<Piece>* pieces);

} // namespace tally::platform
