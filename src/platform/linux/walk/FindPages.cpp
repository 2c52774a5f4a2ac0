#include "platform/linux/walk/FindPages.h"

#include "platform/linux/pages/Mapping.h"

#include <algorithm>
#include <optional>

namespace tally::platform {

bool PageFinder::find(PageRange range, std::vector<PageRange>* found) {
    const std::optional<CachedPages> counts =
        cachedPages(*file_, range.first * basePage, range.pages() * basePage);
    if (!counts) {
        return false;
    }
    const std::size_t before = found->size();
    halve(range, std::min((*counts).*figure_, range.pages()), found);
    if (wasRefused_) {
        found->resize(before);
    }
    return !wasRefused_;
}

std::uint64_t PageFinder::countIn(PageRange range) {
    --questionsLeft_;
    const std::optional<CachedPages> counts =
        cachedPages(*file_, range.first * basePage, range.pages() * basePage);
    wasRefused_ |= !counts;
    return counts ? (*counts).*figure_ : 0;
}

void PageFinder::halve(PageRange range, std::uint64_t count, std::vector<PageRange>* found) {
    if (count == 0 || wasRefused_) {
        return;
    }
    if (count >= range.pages() || questionsLeft_ == 0) {
        found->push_back({range.first, range.first + std::min(count, range.pages())});
        return;
    }
    const PageRange left{range.first, range.first + range.pages() / 2};
    const PageRange right{left.end, range.end};
    const std::uint64_t inLeft = std::min({countIn(left), count, left.pages()});
    halve(left, inLeft, found);
    halve(right, count - inLeft, found);
}

} // namespace tally::platform
