// Walk: the address space of one task as it was read at the start of a walk.
//
// Reads the mappings and the states of their pages once and answers every region and page query from that, so
// that counts and pages agree.

#pragma once

#include "platform/View.h"
#include "platform/kern_return.h"
#include "platform/linux/families/FamilyKey.h"
#include "platform/linux/families/SharedParts.h"
#include "platform/linux/machine/Charges.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/pages/Mapping.h"
#include "platform/linux/walk/Piece.h"

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace tally::platform {

class Walk {
  public:
    struct Result {
        std::unique_ptr<Walk> walk; // null unless KERN_SUCCESS
        kern_return_t status = KERN_SUCCESS;
        std::vector<std::string> notices;
    };

    /// Reads the address space of `task`, with its relatives when a gather measures some.
    /// @param owner who stands for the address space: the task, or one that shares it whole.
    /// @param known its status, where that was just read.
    static Result read(MemberIdentity task, const FamilyKey& key, MemberIdentity owner, View view,
                       std::optional<ProcessStatus> known = {});

    /// The first piece that ends above `address`; null when there is none.
    const Piece* pieceAt(std::uint64_t address) const;
    /// What a query above the last piece answers: KERN_INVALID_ADDRESS, or why the walk could not go on
    /// there.
    kern_return_t statusPastEnd() const { return statusPastEnd_; }
    const Mapping& mappingOf(const Piece& piece) const { return mappings_[piece.mapping]; }
    /// What the page tables show; absent where the walk could not go on to their end.
    std::optional<ResidentMemory> resident() const {
        return statusPastEnd_ == KERN_INVALID_ADDRESS ? std::optional(resident_) : std::nullopt;
    }
    /// All mappings, in rising order.
    std::span<const Mapping> mappings() const { return mappings_; }
    /// The process folder that the mappings were read in.
    const std::string& folder() const { return folder_; }

    /// Divides the task's own pieces by what relatives share, for a walk that was read without them.
    /// @param parts sorted by mapping.
    void divide(std::span<const SharedPart> parts);

    /// Fills one disposition word per page from `address` on.
    void pageWords(std::uint64_t address, std::span<std::int32_t> words) const;

    /// The first page in [address, end) whose word is not 0; `end` when there is none.
    std::uint64_t nextPage(std::uint64_t address, std::uint64_t end) const;

  private:
    /// The dispositions of a piece's pages in rising order, absent ones left out; `byCounts` is room for
    /// them.
    std::span<const PageWords> wordsOf(const Piece& piece, std::array<PageWords, 4>& byCounts) const;
    void pageWordsOf(const Piece& piece, std::uint64_t firstPage, std::span<std::int32_t> words) const;

    std::string folder_;
    std::vector<Mapping> mappings_;
    std::vector<Piece> pieces_; // in rising order
    std::vector<PageWords> words_;
    ResidentMemory resident_;
    kern_return_t statusPastEnd_ = KERN_INVALID_ADDRESS;
};

} // namespace tally::platform
