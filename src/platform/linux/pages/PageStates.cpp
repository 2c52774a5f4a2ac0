#include "platform/linux/pages/PageStates.h"

namespace tally::platform {

void PageStates::append(std::size_t index, const PageStates& part, std::size_t from) {
    const MappingPages& added = part.mappings[from];
    MappingPages& pages = mappings[index];
    pages.object += added.object;
    pages.anonymous += added.anonymous;
    pages.swapped += added.swapped;
    if (added.runCount != 0) {
        pages.firstRun = pages.runCount == 0 ? runs.size() : pages.firstRun;
        pages.runCount += added.runCount;
        const std::span<const PageRun> addedRuns = part.runsOf(added);
        runs.insert(runs.end(), addedRuns.begin(), addedRuns.end());
    }
}

void PageRecorder::record(std::size_t index, std::uint64_t start, std::uint64_t end, PageKind kind) {
    const Mapping& mapping = mappings_[index];
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

} // namespace tally::platform
