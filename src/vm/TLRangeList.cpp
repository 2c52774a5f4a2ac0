#include "vm/TLRangeList.h"

#include "vm/PageRounding.h"

#include <algorithm>
#include <iterator>
#include <utility>

namespace tally {

namespace {

/// What two ranges hold together: never less than either, and what may lie in the overlap of both is counted
/// once.
std::uint64_t mergedBytes(std::uint64_t a, std::uint64_t b, std::uint64_t overlap) {
    const std::uint64_t sum = a + b;
    return std::max({a, b, sum < overlap ? 0 : sum - overlap});
}

bool isBefore(const TLRangeListNode& node, std::uint64_t firstPage, std::uint64_t pageSize) {
    return roundUpToPage(node.end(), pageSize) < firstPage;
}

TLRangeSizes mergedSizes(const TLRangeSizes& a, const TLRangeSizes& b, std::uint64_t overlap) {
    return {
        .dirty = mergedBytes(a.dirty, b.dirty, overlap),
        .swapped = mergedBytes(a.swapped, b.swapped, overlap),
        .clean = mergedBytes(a.clean, b.clean, overlap),
        .reclaimable = mergedBytes(a.reclaimable, b.reclaimable, overlap),
        .wired = mergedBytes(a.wired, b.wired, overlap),
    };
}

} // namespace

TLRangeList::~TLRangeList() {
    while (head_) { // one by one: a chain of nodes that free each other would use up the stack
        head_ = std::move(head_->next);
    }
}

void TLRangeList::addSubrange(std::uint64_t start, std::uint64_t size, std::uint64_t pageSize,
                              const TLRangeSizes& sizes) {
    // A device's offsets can reach past the last address.
    constexpr std::uint64_t last = ~std::uint64_t{0};
    start = std::min(start, last - pageSize);
    size = std::min(size, last - pageSize - start);
    const std::uint64_t firstPage = roundDownToPage(start, pageSize);
    const std::uint64_t pagesEnd = roundUpToPage(start + size, pageSize);
    auto node = std::make_unique<TLRangeListNode>();
    node->start = start;
    node->size = size;
    node->sizes = sizes;

    Link* const link = linkBefore(firstPage, pageSize);
    while (*link && roundDownToPage((*link)->start, pageSize) <= pagesEnd) {
        const TLRangeListNode& other = **link;
        const std::uint64_t overlapStart = std::max(roundDownToPage(other.start, pageSize), firstPage);
        const std::uint64_t overlapEnd = std::min(roundUpToPage(other.end(), pageSize), pagesEnd);
        node->sizes =
            mergedSizes(other.sizes, node->sizes, overlapEnd > overlapStart ? overlapEnd - overlapStart : 0);
        const std::uint64_t end = std::max(other.end(), node->end());
        node->start = std::min(other.start, node->start);
        node->size = end - node->start;
        if (index_) {
            index_->erase(other.start);
        }
        *link = std::move((*link)->next);
    }
    node->next = std::move(*link);
    *link = std::move(node);
    lastInserted_ = link->get();
    if (index_) {
        index_->emplace(lastInserted_->start, lastInserted_);
    }
}

/// The link behind the last node that lies wholly before `firstPage`.
TLRangeList::Link* TLRangeList::linkBefore(std::uint64_t firstPage, std::uint64_t pageSize) {
    constexpr int longWalk = 64; // nodes
    Link* link = &head_;
    if (index_) {
        auto next = index_->lower_bound(firstPage);
        while (next != index_->begin() && !isBefore(*std::prev(next)->second, firstPage, pageSize)) {
            --next;
        }
        link = next == index_->begin() ? &head_ : &std::prev(next)->second->next;
    } else if (lastInserted_ != nullptr && isBefore(*lastInserted_, firstPage, pageSize)) {
        link = &lastInserted_->next;
    }
    int steps = 0;
    for (; *link && isBefore(**link, firstPage, pageSize); link = &(*link)->next) {
        ++steps;
    }
    if (steps > longWalk && !index_) {
        makeIndex();
    }
    return link;
}

void TLRangeList::makeIndex() {
    index_ = std::make_unique<std::map<std::uint64_t, TLRangeListNode*>>();
    for (TLRangeListNode* node = head_.get(); node != nullptr; node = node->next.get()) {
        index_->emplace_hint(index_->end(), node->start, node);
    }
}

void TLRangeList::mergeRangeList(const TLRangeList& other, std::uint64_t pageSize) {
    for (const TLRangeListNode* node = other.rangeListHead(); node != nullptr; node = node->next.get()) {
        addSubrange(node->start, node->size, pageSize, node->sizes);
    }
}

TLRangeSizes TLRangeList::sumSizes() const {
    TLRangeSizes sum;
    for (const TLRangeListNode* node = rangeListHead(); node != nullptr; node = node->next.get()) {
        sum += node->sizes;
    }
    return sum;
}

} // namespace tally
