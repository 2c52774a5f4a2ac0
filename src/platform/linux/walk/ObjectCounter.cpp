#include "platform/linux/walk/ObjectCounter.h"

#include "platform/linux/objects/MapFiles.h"
#include "platform/linux/objects/ObjectId.h"

#include <algorithm>
#include <functional>
#include <optional>

namespace tally::platform {

namespace {

constexpr std::int32_t cleanFilePage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
constexpr std::int32_t dirtyFilePage = cleanFilePage | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr std::int32_t sharedMemoryPage = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr std::int32_t swappedPage = VM_PAGE_QUERY_PAGE_PAGED_OUT;

/// Whether its pages are the only copy, so that the kernel can drop none of them.
bool isOnlyCopy(const BackingObject& object) {
    return object.backing == Backing::sharedMemory || object.backing == Backing::hugetlb ||
           object.backing == Backing::device;
}

/// Takes the first `count` pages of `ranges`: where only a number is known.
std::vector<PageRange> firstPages(std::span<const PageRange> ranges, std::uint64_t count) {
    std::vector<PageRange> taken;
    for (const PageRange& range : ranges) {
        const std::uint64_t pages = std::min(count, range.pages());
        if (pages == 0) {
            break;
        }
        taken.push_back({range.first, range.first + pages});
        count -= pages;
    }
    return taken;
}

std::uint64_t pagesIn(std::span<const PageRange> ranges) {
    std::uint64_t pages = 0;
    for (const PageRange& range : ranges) {
        pages += range.pages();
    }
    return pages;
}

/// Adds `ranges` in the state `word`. Their numbers count from where those of `pages` do.
void add(std::span<const PageRange> ranges, std::int32_t word, ObjectPages& pages) {
    for (const PageRange& range : ranges) {
        pages.words.push_back(
            {range.first - pages.offset / basePage, static_cast<std::uint32_t>(range.pages()), word});
        (word == swappedPage ? pages.swapped : pages.resident) += range.pages();
        pages.dirty += (word & VM_PAGE_QUERY_PAGE_DIRTY) != 0 ? range.pages() : 0;
    }
    std::ranges::sort(pages.words, std::less(), &PageWords::firstPage);
}

} // namespace

ObjectCounter::ObjectCounter(const AddressSpace& space, std::span<const BackingObject> backings,
                             bool swapInUse, SmapsOfProcess& smaps)
    : mappings_(space.mappings), states_(space.states), folder_(space.folder), backings_(backings),
      swapInUse_(swapInUse), smaps_(smaps) {
    for (std::size_t i = 0; i < mappings_.size(); ++i) {
        if (mappings_[i].isFileBacked()) {
            const std::uint64_t id = objectIdOfFile(backings_[i]);
            counted_.expect(id, rangeOf(i));
            if (swapInUse_ && backings_[i].backing == Backing::sharedMemory) {
                counted_.expect(objectIdOfMarkedPages(id), rangeOf(i));
            }
        }
    }
    counted_.prepare();
}

/// The mapped range of the object, in pages.
PageRange ObjectCounter::rangeOf(std::size_t index) const {
    const std::uint64_t first = mappings_[index].fileOffset / basePage;
    return {first, first + mappings_[index].pages()};
}

DividedObject ObjectCounter::startOf(std::size_t index) const {
    DividedObject object;
    object.others.id = objectIdOfFile(backings_[index]);
    object.others.offset = mappings_[index].fileOffset;
    object.marked.id = objectIdOfMarkedPages(object.others.id);
    return object;
}

std::vector<PageRange> ObjectCounter::notYetCounted(std::uint64_t objectId,
                                                    std::span<const PageRange> ranges) {
    std::vector<PageRange> fresh;
    for (const PageRange& range : ranges) {
        counted_.take(objectId, range, &fresh);
    }
    return fresh;
}

/// The pages of the object that the task's page tables show in this mapping.
std::vector<PageRange> ObjectCounter::residentPages(std::size_t index) {
    const std::uint64_t base = rangeOf(index).first;
    std::vector<PageRange> resident;
    for (const PageRun& run : states_.runsOf(states_.mappings[index])) {
        if (run.kind == PageKind::object) {
            resident.push_back({base + run.firstPage, base + run.endPage()});
        }
    }
    return notYetCounted(objectIdOfFile(backings_[index]), resident);
}

/// The mapped pages of which the task's page tables show nothing.
std::vector<PageRange> ObjectCounter::absentPages(std::size_t index) const {
    PageRange rest = rangeOf(index);
    const std::uint64_t base = rest.first;
    std::vector<PageRange> absent;
    for (const PageRun& run : states_.runsOf(states_.mappings[index])) {
        if (rest.first < base + run.firstPage) {
            absent.push_back({rest.first, base + run.firstPage});
        }
        rest.first = base + run.endPage();
    }
    if (rest.first < rest.end) {
        absent.push_back(rest);
    }
    return absent;
}

/// The marked pages of what is mapped, up to the end of the mapping at least.
std::shared_ptr<const MarkedPages> ObjectCounter::marksOf(std::size_t index,
                                                          std::span<const PageRange> resident) {
    const Mapping& mapping = mappings_[index];
    const Backing backing = backings_[index].backing;
    const bool canBeSwapped = swapInUse_ && backing == Backing::sharedMemory;
    // Who has a private mapping has written nothing to the file.
    const bool canBeDirty = backing == Backing::file && mapping.shared && !resident.empty();
    if (!canBeSwapped && !canBeDirty) {
        static const auto none = std::make_shared<const MarkedPages>();
        return none;
    }
    auto marks = markedPages(objectIdOfFile(backings_[index]), rangeOf(index).end,
                             canBeDirty ? &CachedPages::dirty : &CachedPages::evicted,
                             [&] { return openForPageStates(folder_, mapping); });
    return marks ? marks : std::make_shared<const MarkedPages>(estimatedMarks(index, resident));
}

/// By what smaps says of the mapping: how many pages are marked, but not which.
MarkedPages ObjectCounter::estimatedMarks(std::size_t index, std::span<const PageRange> resident) {
    const SmapsEntry* entry = smaps_.entryFor(mappings_[index]);
    if (entry == nullptr) {
        return {};
    }
    if (isOnlyCopy(backings_[index])) {
        const std::uint64_t swapped = entry->swapped / basePage;
        const std::uint64_t own = std::min(swapped, states_.mappings[index].swapped);
        const std::vector<PageRange> absent = absentPages(index);
        usedEstimates_ |= swapped != own && swapped - own < pagesIn(absent);
        return MarkedPages(firstPages(absent, swapped - own));
    }
    const std::vector<PageRange> dirty = firstPages(resident, entry->dirty / basePage);
    usedEstimates_ |= !dirty.empty() && pagesIn(dirty) < pagesIn(resident);
    return MarkedPages(dirty);
}

DividedObject ObjectCounter::charged(std::size_t index) {
    const std::vector<PageRange> resident = residentPages(index);
    return dividedBy(*marksOf(index, resident), index, resident);
}

DividedObject ObjectCounter::dividedBy(const MarkedPages& marks, std::size_t index,
                                       std::span<const PageRange> resident) {
    const bool isFile = !isOnlyCopy(backings_[index]);
    const PageRange range = rangeOf(index);
    const std::uint64_t marksBelow = marks.countBelow(range.first);
    DividedObject object = startOf(index);
    object.others.offset -= marksBelow * basePage;
    object.marked.offset = marksBelow * basePage;
    object.markedRoom = marks.countBelow(range.end) - marksBelow;

    MarkedPages::Division pages;
    for (const PageRange& each : resident) {
        marks.divide(each, &pages);
    }
    add(pages.others, isFile ? cleanFilePage : sharedMemoryPage, object.others);
    add(pages.marked, isFile ? dirtyFilePage : sharedMemoryPage, object.marked);
    if (!isFile && object.markedRoom != 0) {
        MarkedPages::Division absent;
        for (const PageRange& each : absentPages(index)) {
            marks.divide(each, &absent);
        }
        add(notYetCounted(object.marked.id, absent.marked), swappedPage, object.marked);
    }
    return object;
}

DividedObject ObjectCounter::seen(std::size_t index) {
    const Backing backing = backings_[index].backing;
    if (backing != Backing::sharedMemory && backing != Backing::file) {
        return charged(index);
    }
    const Mapping& mapping = mappings_[index];
    const Descriptor file = openForPageStates(folder_, mapping);
    const std::optional<CachedPages> inside = cachedOrHeldPages(file, mapping.fileOffset, mapping.size());
    const std::optional<CachedPages> below = cachedOrHeldPages(file, 0, mapping.fileOffset);
    if (!inside || !below) {
        usedEstimates_ = true;
        return charged(index);
    }
    // Whoever maps the range finds the same pages: numbered through the object, they merge exactly.
    DividedObject object = startOf(index);
    object.restIsApart = true;
    const auto dirtyOf = [](const CachedPages& pages) { return std::min(pages.dirty, pages.cached); };
    if (backing == Backing::file) {
        object.others.offset = (below->cached - dirtyOf(*below)) * basePage;
        object.others.resident = inside->cached - dirtyOf(*inside);
        object.marked.offset = dirtyOf(*below) * basePage;
        object.marked.resident = dirtyOf(*inside);
        object.marked.dirty = object.marked.resident;
    } else {
        object.others.offset = below->cached * basePage;
        object.others.resident = inside->cached;
        object.others.dirty = object.others.resident;
        object.marked.offset = swapInUse_ ? below->evicted * basePage : 0;
        object.marked.swapped = swapInUse_ ? inside->evicted : 0;
    }
    object.markedRoom = object.marked.held();
    return object;
}

} // namespace tally::platform
