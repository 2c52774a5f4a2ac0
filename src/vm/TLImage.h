// TLImage: one segment of a loaded image, and the cursor that finds the segment of a mapping.

#pragma once

#include "base/Name.h"
#include "vm/TLMemoryRegion.h"

#include <cstddef>
#include <cstdint>
#include <string_view>
#include <vector>

namespace tally {

struct TLImage {
    TLSegmentKind segment = TLSegmentKind::notSet;
    std::uint64_t start = 0;
    std::uint64_t size = 0; // bytes
    Name name;              // of the segment
    Name ownerPath;         // of the image file

    std::uint64_t end() const { return start + size; }
    /// Sets `name`, and `segment` by the rule for segment names.
    void setName(Name segmentName);
};

/// The kind that a segment's name stands for.
TLSegmentKind segmentKindForName(std::string_view name);

/// A cursor over images sorted by start; it only moves forward, so it is asked in rising address order.
/// The list may grow at its end meanwhile.
class TLImageEnumerator {
  public:
    explicit TLImageEnumerator(const std::vector<TLImage>& images) : images_(&images) {}

    /// The first image at or after the cursor that overlaps [start, end), or contains `start` when that is
    /// the end; null when there is none. The cursor stays on an image that was returned. The pointer is valid
    /// until the list changes.
    const TLImage* nextImageOverlapping(std::uint64_t start, std::uint64_t end);

  private:
    const std::vector<TLImage>* images_;
    std::size_t index_ = 0;
};

} // namespace tally
