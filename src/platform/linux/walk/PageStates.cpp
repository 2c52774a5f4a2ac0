#include "platform/linux/walk/PageStates.h"

#include "platform/linux/walk/PageScan.h"
#include "platform/linux/walk/SmapsPages.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>

namespace tally::platform {

namespace {

// The kernel takes twice the time when it is asked to tell file pages from others. Private anonymous memory
// has none, so neighbouring anonymous mappings of this many bytes in all are scanned without.
constexpr std::uint64_t worthOwnSegment = 1 << 20;

/// Consecutive mappings that are scanned in one go.
struct Segment {
    std::size_t first = 0;
    std::size_t end = 0;
    bool withFile = false;
};

std::vector<Segment> segmentsOf(std::span<const Mapping> mappings) {
    std::vector<Segment> segments;
    for (std::size_t at = 0; at < mappings.size();) {
        std::size_t end = at;
        std::uint64_t bytes = 0;
        while (end < mappings.size() && mappings[end].isPrivateAnonymous()) {
            bytes += mappings[end++].size();
        }
        if (bytes >= worthOwnSegment) {
            segments.push_back({at, end, false});
        } else {
            end = std::max(end, at + 1);
            if (!segments.empty() && segments.back().withFile) {
                segments.back().end = end;
            } else {
                segments.push_back({at, end, true});
            }
        }
        at = end;
    }
    return segments;
}

class Scanner {
  public:
    Scanner(int pagemap, std::span<const Mapping> mappings, PageStates* states)
        : pagemap_(pagemap), mappings_(mappings), recorder_(mappings, states) {}

    /// @return 0 or the error; the mappings of the segment before `*reached` are complete then.
    int scan(const Segment& segment, std::size_t* reached) {
        std::size_t mapping = segment.first;
        std::uint64_t address = mappings_[mapping].start;
        while (mapping < segment.end) {
            const std::uint64_t end = mappings_[segment.end - 1].end;
            PageScanStep step;
            if (const int error = scanPages(pagemap_, address, end, segment.withFile, room_, &step);
                error != 0) {
                *reached = mapping;
                return error;
            }
            for (const PageRegion& region : step.regions) {
                record(region, segment.end, mapping);
            }
            address = step.resume;
            while (mapping < segment.end && mappings_[mapping].end <= address) {
                ++mapping;
            }
            if (mapping < segment.end) {
                address = std::max(address, mappings_[mapping].start); // what lies between is not scanned
            }
        }
        *reached = segment.end;
        return 0;
    }

  private:
    /// Records a region, which may reach over several mappings and what lies between them.
    void record(const PageRegion& region, std::size_t end, std::size_t& mapping) {
        const bool zero = (region.categories & PageIsZero) != 0;
        const bool guard = (region.categories & PageIsGuard) != 0;
        if (zero || guard) {
            return;
        }
        const PageKind kind = (region.categories & PageIsFile) != 0      ? PageKind::object
                              : (region.categories & PageIsPresent) != 0 ? PageKind::anonymous
                                                                         : PageKind::swapped;
        while (mapping < end && mappings_[mapping].start < region.end) {
            recorder_.record(mapping, region.start, region.end, kind);
            if (mappings_[mapping].end > region.end) {
                return;
            }
            ++mapping;
        }
    }

    int pagemap_;
    std::span<const Mapping> mappings_;
    PageRecorder recorder_;
    std::array<PageRegion, 512> room_;
};

} // namespace

void PageRecorder::record(std::size_t index, std::uint64_t start, std::uint64_t end, PageKind kind) {
    const Mapping& mapping = mappings_[index];
    start = std::max(start, mapping.start);
    end = std::min(end, mapping.end);
    // A shared mapping has no memory of the task's own: what shows there is a device's.
    const bool foreign = kind != PageKind::object && (mapping.shared || mapping.isKernelSpecial());
    if (start >= end || foreign) {
        return;
    }
    MappingPages& pages = states_->mappings[index];
    const PageRun run{(start - mapping.start) / basePage, (end - start) / basePage, kind};
    (kind == PageKind::object      ? pages.object
     : kind == PageKind::anonymous ? pages.anonymous
                                   : pages.swapped) += run.pages;
    if (mapping.isPrivateAnonymous()) {
        return;
    }
    if (pages.runCount == 0) {
        pages.firstRun = states_->runs.size();
    } else if (PageRun& last = states_->runs.back(); last.endPage() == run.firstPage && last.kind == kind) {
        last.pages += run.pages;
        return;
    }
    states_->runs.push_back(run);
    ++pages.runCount;
}

kern_return_t readPageStates(const ProcessMemoryFiles& files, std::span<const Mapping> mappings,
                             SmapsOfProcess& smaps, PageStates* states) {
    static std::atomic<bool> scansAnswered = true; // false once this kernel has refused one
    states->mappings.assign(mappings.size(), MappingPages());
    if (!scansAnswered) {
        return readPagesBySmaps(files, mappings, smaps, states);
    }
    Scanner scanner(files.pagemap.number(), mappings, states);
    bool someUnreadable = false;
    for (const Segment& segment : segmentsOf(mappings)) {
        std::size_t reached = segment.first;
        const int error = scanner.scan(segment, &reached);
        if (error == ENOTTY) {
            scansAnswered = false;
            states->mappings.assign(mappings.size(), MappingPages());
            states->runs.clear();
            return readPagesBySmaps(files, mappings, smaps, states);
        }
        if (error == ESRCH) {
            states->mappings.resize(reached);
            return KERN_INVALID_ARGUMENT;
        }
        for (std::size_t i = reached; i < segment.end; ++i) {
            states->mappings[i] = {.unreadable = true};
            someUnreadable = true;
        }
    }
    return someUnreadable ? readPagesBySmaps(files, mappings, smaps, states) : KERN_SUCCESS;
}

} // namespace tally::platform
