#include "platform/linux/walk/PageStates.h"

#include "platform/linux/walk/PageSource.h"
#include "platform/linux/walk/SmapsOfProcess.h"

#include <algorithm>
#include <cerrno>

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

kern_return_t readPageStates(PageSource& source, SmapsOfProcess& smaps, std::span<const Mapping> mappings,
                             PageStates* states) {
    *states = PageStates(mappings.size());
    PageRecorder recorder(mappings, states);
    const PageRunSink sink = [&](const FoundRun& run) {
        recorder.record(run.mapping, run.start, run.end, run.kind);
    };
    const AddressRange everywhere{0, ~std::uint64_t{0}};
    for (std::size_t at = 0; at < mappings.size();) {
        const int error = source.read(at, mappings.size(), everywhere, sink, &at);
        if (error == ESRCH) {
            states->mappings.resize(at);
            return KERN_INVALID_ARGUMENT;
        }
        if (error != 0) {
            // This mapping cannot be read page by page: smaps gives the counts, at nominal places.
            MappingPages& pages = states->mappings[at] = {};
            const SmapsEntry* entry = smaps.entryFor(mappings[at]);
            pages.unreadable = entry == nullptr;
            if (entry != nullptr) {
                const std::uint64_t own = mappings[at].start + entry->anonymous;
                recorder.record(at, mappings[at].start, own, PageKind::anonymous);
                recorder.record(at, own, own + entry->resident - entry->anonymous, PageKind::object);
            }
            ++at;
        }
    }
    return KERN_SUCCESS;
}

} // namespace tally::platform
