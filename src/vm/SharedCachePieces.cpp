#include "vm/SharedCachePieces.h"

#include "vm/PageRounding.h"
#include "vm/RegionWalk.h"

#include <algorithm>
#include <utility>

namespace tally {

namespace {

bool isMultipleOf(std::uint64_t unit, std::uint64_t value) { return roundDownToPage(value, unit) == value; }

/// Text and symbols of the cache are never dirty, so their pages need not be asked for.
bool isNeverDirty(TLSegmentKind kind) {
    return kind == TLSegmentKind::text || kind == TLSegmentKind::linkedit;
}

/// A gap belongs to the data beside it, if there is some.
TLSegmentKind gapSegment(const TLImage* previous, const TLImage* next) {
    if (previous == nullptr) {
        return next == nullptr ? TLSegmentKind::notSet : next->segment;
    }
    const bool nextIsData = next != nullptr && !isNeverDirty(next->segment);
    return isNeverDirty(previous->segment) && nextIsData ? next->segment : previous->segment;
}

class PieceCutter {
  public:
    PieceCutter(WalkedTask& task, TLImageEnumerator& images, const EnumeratedRegion& mapping)
        : task_(task), images_(images), mapping_(mapping), at_(mapping.start) {}

    bool cut();

  private:
    TLMemoryRegion piece(std::uint64_t end) const;
    bool appendGap(const TLImage* image);
    bool appendImagePiece(const TLImage& image);
    std::uint64_t imagePieceEnd(const TLImage& image);
    bool append(TLMemoryRegion piece, bool withPageQueries);

    WalkedTask& task_;
    TLImageEnumerator& images_;
    const EnumeratedRegion& mapping_;
    std::uint64_t at_;                  // where the next piece begins
    const TLImage* previous_ = nullptr; // the image of the last image piece
};

bool PieceCutter::cut() {
    task_.pendingUnusedSharedRegion.reset();
    while (at_ < mapping_.end()) {
        const TLImage* const image = images_.nextImageOverlapping(at_, mapping_.end());
        const bool isGap = image == nullptr || at_ < image->start;
        if (!(isGap ? appendGap(image) : appendImagePiece(*image))) {
            announceBailOut(task_);
            return false;
        }
    }
    return true;
}

TLMemoryRegion PieceCutter::piece(std::uint64_t end) const {
    TLMemoryRegion piece;
    piece.inSharedCache = true;
    piece.start = at_;
    piece.setEnd(end);
    piece.offset = at_ - mapping_.start + mapping_.info.offset;
    piece.user_tag = mapping_.info.user_tag;
    piece.object_id = mapping_.info.object_id_full;
    piece.share_mode = mapping_.info.share_mode;
    piece.wired = mapping_.info.user_wired_count != 0;
    return piece;
}

bool PieceCutter::appendGap(const TLImage* image) {
    static const Name unused("unused dyld shared cache area");
    TLMemoryRegion gap = piece(image == nullptr ? mapping_.end() : image->start);
    gap.unusedSharedCacheRegion = true;
    gap.name = unused;
    gap.segment = gapSegment(previous_, image);
    const bool isWholePages =
        isMultipleOf(task_.pageSize, gap.start) && isMultipleOf(task_.pageSize, gap.end());
    const bool needsQueries = !isNeverDirty(gap.segment) && !isWholePages;
    return append(std::move(gap), needsQueries);
}

bool PieceCutter::appendImagePiece(const TLImage& image) {
    TLMemoryRegion part = piece(imagePieceEnd(image));
    part.name = image.name;
    part.detailedName = image.ownerPath;
    part.segment = image.segment;
    previous_ = &image;
    const bool needsQueries = !isNeverDirty(image.segment);
    if (!needsQueries) {
        task_.pendingUnusedSharedRegion.reset();
    }
    return append(std::move(part), needsQueries);
}

/// Where the piece of `image` that begins here ends: with the image, or where padding after it does.
std::uint64_t PieceCutter::imagePieceEnd(const TLImage& image) {
    const std::uint64_t alignment = task_.sharedCache->alignment;
    const std::uint64_t end = std::min(image.end(), mapping_.end());
    const TLImage* const next = images_.nextImageOverlapping(end, mapping_.end());
    const bool startsAreAligned =
        isMultipleOf(alignment, at_) && isMultipleOf(alignment, next == nullptr ? 0 : next->start);
    return next != &image && startsAreAligned ? std::max(end, roundUpToPage(end, alignment)) : end;
}

bool PieceCutter::append(TLMemoryRegion piece, bool withPageQueries) {
    at_ = piece.end();
    auto& regions = task_.regions;
    TLMemoryRegion& appended = regions.emplace_back(std::move(piece));
    if (withPageQueries && !task_.populateMemoryRegionWithPageQueries(appended, mapping_.info)) {
        regions.pop_back();
        return false;
    }
    return true;
}

} // namespace

bool recordSharedCachePieces(WalkedTask& task, TLImageEnumerator& images, const EnumeratedRegion& mapping) {
    return PieceCutter(task, images, mapping).cut();
}

} // namespace tally
