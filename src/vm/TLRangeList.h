// TLRangeList: the union of byte ranges of one VM object.
//
// Decides how overlapping ranges merge; knows nothing of processes or formats.
// Invariant: nodes are sorted by start and no two share a page or touch at a page boundary.
// Cost: an insertion walks the chain, from the last insertion on where that lies before the new range. The
// first long walk makes an index, since a file can be mapped in pieces in any order: from then on an
// insertion costs the logarithm of the length. Nodes are freed as they fold. Not thread-safe: a list belongs
// to one object and one thread.

#pragma once

#include "vm/TLRangeSizes.h"

#include <cstdint>
#include <map>
#include <memory>

namespace tally {

struct TLMemoryRegion;

struct TLRangeListNode {
    std::uint64_t start = 0; // offset in the VM object, bytes
    std::uint64_t size = 0;
    TLRangeSizes sizes;
    std::unique_ptr<TLRangeListNode> next;

    std::uint64_t end() const { return start + size; }
};

class TLRangeList {
  public:
    TLRangeList() = default;
    TLRangeList(const TLRangeList&) = delete;
    TLRangeList& operator=(const TLRangeList&) = delete;
    ~TLRangeList();

    /// Adds [start, start + size). Where it overlaps a node, each counter of the merged node is
    /// max(either, sum - overlap): the overlap is never counted twice and neither part is lost.
    void addSubrange(std::uint64_t start, std::uint64_t size, std::uint64_t pageSize,
                     const TLRangeSizes& sizes);
    /// Adds the subranges of `region` if it has some, else the region as one range.
    void addRegionRange(const TLMemoryRegion& region, std::uint64_t pageSize);
    void mergeRangeList(const TLRangeList& other, std::uint64_t pageSize);
    TLRangeSizes sumSizes() const;

    const TLRangeListNode* rangeListHead() const { return head_.get(); }

  private:
    using Link = std::unique_ptr<TLRangeListNode>;

    Link* linkBefore(std::uint64_t firstPage, std::uint64_t pageSize);
    void makeIndex();

    Link head_;
    TLRangeListNode* lastInserted_ = nullptr;
    std::unique_ptr<std::map<std::uint64_t, TLRangeListNode*>>
        index_; // by start; absent until it is worth it
};

} // namespace tally
