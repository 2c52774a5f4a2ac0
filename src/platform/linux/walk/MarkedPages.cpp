#include "platform/linux/walk/MarkedPages.h"

#include "platform/linux/io/Gather.h"
#include "platform/linux/walk/FindPages.h"

#include <algorithm>
#include <mutex>
#include <unordered_map>

namespace tally::platform {

namespace {

/// One object; whoever asks for it first keeps the others waiting for the answer.
struct Entry {
    std::mutex mutex;
    std::shared_ptr<const MarkedPages> pages = std::make_shared<MarkedPages>();
};

struct MarkTable {
    std::mutex mutex;
    std::unordered_map<std::uint64_t, std::shared_ptr<Entry>> entries; // by object id
};

std::shared_ptr<Entry> entryOf(std::uint64_t objectId) {
    MarkTable* const table = Gather::table<MarkTable>();
    if (table == nullptr) {
        return std::make_shared<Entry>();
    }
    const std::scoped_lock lock(table->mutex);
    std::shared_ptr<Entry>& entry = table->entries[objectId];
    if (!entry) {
        entry = std::make_shared<Entry>();
    }
    return entry;
}

} // namespace

std::vector<MarkedPages::Marked>::const_iterator MarkedPages::firstAbove(std::uint64_t page) const {
    return std::upper_bound(marked_.begin(), marked_.end(), page,
                            [](std::uint64_t at, const Marked& marked) { return at < marked.range.end; });
}

std::uint64_t MarkedPages::countBelow(std::uint64_t page) const {
    const auto next = firstAbove(page);
    if (next != marked_.end()) {
        return next->below + (std::max(page, next->range.first) - next->range.first);
    }
    return marked_.empty() ? 0 : marked_.back().below + marked_.back().range.pages();
}

void MarkedPages::divide(PageRange range, Division* division) const {
    std::uint64_t below = countBelow(range.first);
    const auto addOthers = [&](std::uint64_t end) {
        if (range.first < end) {
            division->others.push_back({range.first - below, end - below});
        }
    };
    for (auto next = firstAbove(range.first); next != marked_.end() && next->range.first < range.end;
         ++next) {
        const PageRange marked{std::max(next->range.first, range.first),
                               std::min(next->range.end, range.end)};
        addOthers(marked.first);
        division->marked.push_back({below, below + marked.pages()});
        below += marked.pages();
        range.first = marked.end;
    }
    addOthers(range.end);
}

void MarkedPages::append(std::span<const PageRange> ranges) {
    for (const PageRange& range : ranges) {
        marked_.push_back({range, countBelow(range.first)});
    }
}

std::shared_ptr<const MarkedPages> MarkedPages::extendedTo(std::uint64_t end, const Descriptor& file,
                                                           std::uint64_t CachedPages::*mark) const {
    std::vector<PageRange> found;
    if (!PageFinder(file, mark).find({knownEnd_, end}, &found)) {
        return nullptr;
    }
    auto extended = std::make_shared<MarkedPages>(*this);
    extended->knownEnd_ = end;
    extended->append(found);
    return extended;
}

std::shared_ptr<const MarkedPages> markedPages(std::uint64_t objectId, std::uint64_t end,
                                               std::uint64_t CachedPages::*mark,
                                               const std::function<Descriptor()>& openFile) {
    const std::shared_ptr<Entry> entry = entryOf(objectId);
    const std::scoped_lock lock(entry->mutex);
    if (entry->pages->knownEnd() < end) {
        auto extended = entry->pages->extendedTo(end, openFile(), mark);
        if (!extended) {
            return nullptr;
        }
        entry->pages = std::move(extended);
    }
    return entry->pages;
}

} // namespace tally::platform
