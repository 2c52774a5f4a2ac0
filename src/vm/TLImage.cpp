#include "vm/TLImage.h"

namespace tally {

TLSegmentKind segmentKindForName(std::string_view name) {
    if (name.starts_with("__TEXT") || name.starts_with("__OBJC_RO")) {
        return TLSegmentKind::text;
    }
    if (name == "__LINKEDIT") {
        return TLSegmentKind::linkedit;
    }
    return name.starts_with("__") ? TLSegmentKind::data : TLSegmentKind::notSet;
}

void TLImage::setName(Name segmentName) {
    name = segmentName;
    segment = segmentKindForName(segmentName.view());
}

const TLImage* TLImageEnumerator::nextImageOverlapping(std::uint64_t start, std::uint64_t end) {
    for (; index_ < images_->size(); ++index_) {
        const TLImage& image = (*images_)[index_];
        const bool isBefore = image.end() <= start || image.size == 0; // an empty one covers nothing
        if (!isBefore) {
            return image.start <= start || image.start < end ? &image : nullptr;
        }
    }
    return nullptr;
}

} // namespace tally
