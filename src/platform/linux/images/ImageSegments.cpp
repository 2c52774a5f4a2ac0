#include "platform/linux/images/ImageSegments.h"

#include <algorithm>
#include <cstddef>

namespace tally::platform {

namespace {

bool isReadOnly(const LoadSegment& load) { return !load.writable && !load.executable; }

/// Whether the first read-only segment holds what only linkers need: symbols and relocations. So it is where
/// another one, which then holds the constants, follows the code.
bool beginsWithLinkerData(const std::vector<LoadSegment>& loads) {
    const auto code =
        std::find_if(loads.begin(), loads.end(), [](const LoadSegment& l) { return l.executable; });
    return std::any_of(loads.begin(), code, isReadOnly) && std::any_of(code, loads.end(), isReadOnly);
}

class ImageMappings {
  public:
    ImageMappings(const ElfLayout& layout, std::uint64_t bias, const Mapping& file)
        : layout_(layout), bias_(bias), file_(file), linkedit_(layout.loads.end()) {
        if (beginsWithLinkerData(layout.loads)) {
            linkedit_ = std::find_if(layout.loads.begin(), layout.loads.end(), isReadOnly);
        }
    }

    /// The name of the segment that `mapping` lies in; null when it is none of the image's.
    const char* segmentOf(const Mapping& mapping, bool adjoinsImage) const {
        const std::uint64_t start = mapping.start - bias_;
        auto load = std::upper_bound(
            layout_.loads.begin(), layout_.loads.end(), start,
            [](std::uint64_t address, const LoadSegment& l) { return address < l.firstPage(); });
        if (load == layout_.loads.begin() || start >= (--load)->endPage()) {
            return nullptr;
        }
        if (mapping.isFileBacked()) {
            const bool isOfImage = mapping.inode == file_.inode && mapping.deviceMajor == file_.deviceMajor &&
                                   mapping.deviceMinor == file_.deviceMinor &&
                                   mapping.fileOffset - start == load->fileOffset - load->address;
            return isOfImage ? nameOf(load, start, mapping) : nullptr;
        }
        return isMemoryOf(*load, start, mapping, adjoinsImage) ? nameOf(load, start, mapping) : nullptr;
    }

  private:
    using Load = std::vector<LoadSegment>::const_iterator;

    /// Whether memory without a file is the segment's. The kernel merges it with what happens to lie behind
    /// it: then the larger part decides.
    static bool isMemoryOf(const LoadSegment& load, std::uint64_t start, const Mapping& mapping,
                           bool adjoinsImage) {
        const bool isNameless =
            mapping.isPrivateAnonymous() && (mapping.name.empty() || mapping.name == "[anon:.bss]");
        return isNameless && (adjoinsImage || start == load.firstPage()) &&
               mapping.size() / 2 < load.endPage() - start;
    }

    const char* nameOf(Load load, std::uint64_t start, const Mapping& mapping) const {
        if (load->executable) {
            return "__TEXT";
        }
        if (!load->writable) {
            return load == linkedit_ ? "__LINKEDIT" : "__TEXT";
        }
        if (!mapping.isFileBacked() && start >= load->endOfFilePages()) {
            return "__BSS";
        }
        const bool isConstant = start >= layout_.relroStart && start + mapping.size() <= layout_.relroEnd;
        return isConstant ? "__DATA_CONST" : "__DATA";
    }

    const ElfLayout& layout_;
    std::uint64_t bias_;
    const Mapping& file_;
    Load linkedit_;
};

} // namespace

std::optional<std::uint64_t> biasOf(const ElfLayout& layout, const Mapping& mapping) {
    const LoadSegment* found = nullptr;
    for (const LoadSegment& load : layout.loads) {
        const std::uint64_t firstOffset = load.fileOffset - (load.address - load.firstPage());
        if (load.executable && load.fileSize != 0 && mapping.fileOffset >= firstOffset &&
            mapping.fileOffset < load.fileOffset + load.fileSize) {
            found = &load; // two can share a page: the one that begins there was mapped last
        }
    }
    if (found == nullptr) {
        return std::nullopt;
    }
    return mapping.start - mapping.fileOffset + found->fileOffset - found->address;
}

std::vector<RKSegment> segmentsOf(const ElfLayout& layout, std::uint64_t bias, const Mapping& file,
                                  std::span<const Mapping> mappings) {
    const ImageMappings image(layout, bias, file);
    const std::uint64_t start = bias + layout.loads.front().firstPage();
    const std::uint64_t end = bias + layout.loads.back().endPage();
    std::vector<RKSegment> segments;
    auto at = std::lower_bound(
        mappings.begin(), mappings.end(), start,
        [](const Mapping& mapping, std::uint64_t address) { return mapping.start < address; });
    std::uint64_t imageEnd = 0; // of the mappings so far, when the last was the image's
    for (; at != mappings.end() && at->start < end; ++at) {
        const char* name = image.segmentOf(*at, at->start == imageEnd);
        if (name == nullptr) {
            continue;
        }
        imageEnd = at->end;
        if (!segments.empty() && segments.back().name == name &&
            segments.back().start + segments.back().size == at->start) {
            segments.back().size += at->size();
        } else {
            segments.push_back({at->start, at->size(), name});
        }
    }
    return segments;
}

} // namespace tally::platform
