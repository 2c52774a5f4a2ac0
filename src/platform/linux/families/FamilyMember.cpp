#include "platform/linux/families/FamilyMember.h"

#include "platform/linux/pages/PageScan.h"
#include "platform/linux/pages/PagemapEntry.h"

#include <algorithm>
#include <cerrno>

namespace tally::platform {

namespace {

constexpr std::uint64_t mostReadAtOnce = 1 << 20; // bytes; a huge page does not fit in
constexpr std::uint64_t nowhere = ~std::uint64_t{0};

/// The key of an entry, 0 where it shows no page of the member's own. Without frames, pages at one address
/// that the kernel does not call exclusive are taken for one page.
PageKey keyOf(std::uint64_t entry, std::uint32_t member, bool* framesTold) {
    const std::uint64_t place = entry & pagemap::place;
    if ((entry & (pagemap::present | pagemap::swapped)) == 0 || (entry & pagemap::file) != 0) {
        return 0;
    }
    if ((entry & pagemap::swapped) != 0 || place != 0) {
        return place | ((entry & pagemap::swapped) != 0 ? 0 : residentKey);
    }
    *framesTold = false;
    return residentKey | ((entry & pagemap::exclusive) != 0 ? member + 1 : 0);
}

/// Whether reading on over the hole between two ranges is cheaper than another call.
bool areClose(const AddressRange& lower, const AddressRange& upper) {
    return upper.start - lower.end <= 64 * basePage;
}

} // namespace

void MemberStretch::breakOff(int error, std::size_t mapping) {
    status = error == ESRCH ? KERN_INVALID_ARGUMENT : KERN_FAILURE;
    states.mappings.resize(mapping - firstMapping);
}

void WindowRow::writeOut() {
    // Only frames differ from page to page: where they are hidden, a key tells no more than who has the page.
    const PageKey step = framesAreTold() && keys[0] != 0 ? 1 : 0;
    for (std::size_t i = 1; i < keys.size(); ++i) {
        keys[i] = keys[0] + i * step;
    }
    holds = Holds::pages;
}

bool WindowRow::isFullOfPages() const {
    const bool isHuge = keys.front() % windowPages == 0 && keys.back() == keys.front() + windowPages - 1;
    return holds == Holds::pages && !isHuge &&
           static_cast<std::size_t>(std::ranges::count(keys, PageKey{0})) < windowPages / 2;
}

FamilyMember::FamilyMember(MemberIdentity identity, std::uint32_t number) : number_(number) {
    space_.status = files_.open(identity.pid, identity.startTicks, &space_.mappings);
    space_.folder = files_.folder;
    files_.maps = Descriptor(); // one descriptor a member is enough
    smaps_ = std::make_unique<SmapsOfProcess>(files_.folder);
    source_ = std::make_unique<PageSource>(files_, space_.mappings, *smaps_, PageDetail::positions);
    privateMappings_ = tally::platform::privateMappings(space_.mappings);
    space_.states = PageStates(space_.mappings.size());
    PageRecorder recorder(space_.mappings, &space_.states);
    const auto record = [&](const FoundRun& run) {
        recorder.record(run.mapping, run.start, run.end, run.kind);
    };
    const auto indexOf = [&](auto at) { return static_cast<std::size_t>(at - space_.mappings.begin()); };
    const auto isPrivate = [](const Mapping& mapping) { return mapping.isPrivate(); };
    for (auto at = space_.mappings.begin(); isReadable() && at != space_.mappings.end();) {
        at = std::find_if_not(at, space_.mappings.end(), isPrivate);
        const auto end = std::find_if(at, space_.mappings.end(), isPrivate);
        std::size_t reached = 0;
        const int error =
            at == end ? 0 : source_->read(indexOf(at), indexOf(end), {0, nowhere}, record, &reached);
        if (error != 0) {
            space_.status = error == ESRCH ? KERN_INVALID_ARGUMENT : KERN_FAILURE;
            space_.states.mappings.resize(reached);
        }
        at = end;
    }
    std::vector<std::size_t> asked;
    for (const MemberMapping& mapping : privateMappings_) {
        if (!isReadAtOnce(mapping.index, MemberStretch::none)) {
            asked.push_back(mapping.index);
        }
    }
    asked_ = std::make_unique<AskedPages>(*source_, space_.mappings, std::move(asked));
}

/// Whether the entries of a mapping are read without asking where its pages are, since `full` is.
bool FamilyMember::isReadAtOnce(std::size_t mapping, std::size_t full) const {
    return framesAreTold() && (mapping == full || space_.mappings[mapping].size() <= mostReadAtOnce);
}

std::uint64_t FamilyMember::nextPage(std::uint64_t address) {
    const std::size_t full = full_;
    auto at = privateAbove(address);
    while (at != privateMappings_.end() && !isReadAtOnce(at->index, full)) {
        ++at;
    }
    const std::uint64_t next = at == privateMappings_.end() ? nowhere : std::max(address, at->range.start);
    if (!isReadable() || next <= address) {
        return isReadable() ? next : nowhere;
    }
    const std::uint64_t asked = asked_->next(address);
    return asked_->error() != 0 ? address : std::min(next, asked); // an error shows when it is read
}

std::uint64_t FamilyMember::nextPage(const MemberStretch& stretch, std::uint64_t address) const {
    const auto run =
        std::find_if(stretch.asked.begin() + static_cast<std::ptrdiff_t>(stretch.nextAsked),
                     stretch.asked.end(), [&](const FoundRun& each) { return each.end > address; });
    const std::uint64_t next = run == stretch.asked.end() ? nowhere : std::max(address, run->start);
    for (std::size_t at = stretch.nextMapping;
         at < privateMappings_.size() && privateMappings_[at].range.start < next; ++at) {
        if (privateMappings_[at].range.end > address &&
            isReadAtOnce(privateMappings_[at].index, stretch.full)) {
            return std::max(address, privateMappings_[at].range.start);
        }
    }
    return next;
}

/// The first mapping that ends above `address`.
std::vector<Mapping>::const_iterator FamilyMember::mappingAbove(std::uint64_t address) const {
    return std::upper_bound(
        space_.mappings.begin(), space_.mappings.end(), address,
        [](std::uint64_t wanted, const Mapping& mapping) { return wanted < mapping.end; });
}

std::vector<MemberMapping>::const_iterator FamilyMember::privateAbove(std::uint64_t address) const {
    return std::upper_bound(
        privateMappings_.begin(), privateMappings_.end(), address,
        [](std::uint64_t wanted, const MemberMapping& mapping) { return wanted < mapping.range.end; });
}

void FamilyMember::expect(std::uint64_t end, const WindowRow* last) {
    const auto at = mappingAbove(end - 1);
    const bool isFull = last != nullptr && at != space_.mappings.end() && at->end > end && framesAreTold() &&
                        last->isFullOfPages();
    full_ = isFull ? static_cast<std::size_t>(at - space_.mappings.begin()) : MemberStretch::none;
}

MemberStretch FamilyMember::begin(AddressRange range) {
    const std::vector<Mapping>& all = space_.mappings;
    const auto first = mappingAbove(range.start);
    const auto end =
        std::lower_bound(first, all.end(), range.end, [](const Mapping& mapping, std::uint64_t address) {
            return mapping.start < address;
        });
    MemberStretch stretch;
    stretch.member = number_;
    stretch.firstMapping = static_cast<std::size_t>(first - all.begin());
    stretch.states = PageStates(static_cast<std::size_t>(end - first));
    stretch.nextMapping = static_cast<std::size_t>(privateAbove(range.start) - privateMappings_.begin());
    stretch.full = full_;
    if (stretch.full != MemberStretch::none && all[stretch.full].start < range.end) {
        asked_->skip(std::min(range.end, all[stretch.full].end));
    }
    asked_->skip(range.start);
    std::vector<FoundRun> runs = asked_->takeBelow(range.end);
    if (asked_->error() != 0) {
        stretch.breakOff(asked_->error(), stretch.firstMapping); // what is read at once was not read yet
        return stretch;
    }
    PageRecorder recorder(std::span(first, end), &stretch.states);
    for (const FoundRun& run : runs) {
        recorder.record(run.mapping - stretch.firstMapping, run.start, run.end, run.kind);
    }
    std::erase_if(runs, [](const FoundRun& run) { return run.kind == PageKind::object; });
    stretch.asked = std::move(runs);
    return stretch;
}

bool FamilyMember::readWindow(std::uint64_t start, MemberStretch& stretch, WindowRow& row) const {
    row.member = number_;
    row.holds = WindowRow::Holds::nothing;
    const std::uint64_t end = start + windowBytes;
    if (nextPage(stretch, start) >= end) {
        return true;
    }
    row.keys.fill(0);
    while (stretch.nextAsked < stretch.asked.size() && stretch.asked[stretch.nextAsked].end <= start) {
        ++stretch.nextAsked;
    }
    if (stretch.nextAsked < stretch.asked.size() && stretch.asked[stretch.nextAsked].start < end) {
        row.holds = WindowRow::Holds::pages;
    }
    std::size_t& next = stretch.nextMapping;
    while (next < privateMappings_.size() && privateMappings_[next].range.end <= start) {
        ++next;
    }
    bool framesTold = true;
    for (std::size_t at = next; stretch.status == KERN_SUCCESS && at < privateMappings_.size() &&
                                privateMappings_[at].range.start < end;) {
        std::size_t stop = at;
        while (stop < privateMappings_.size() && privateMappings_[stop].range.start < end &&
               isReadAtOnce(privateMappings_[stop].index, stretch.full) &&
               (stop == at || areClose(privateMappings_[stop - 1].range, privateMappings_[stop].range))) {
            ++stop;
        }
        const auto neighbours = std::span(privateMappings_).subspan(at, stop - at);
        framesTold &= neighbours.empty() || readAtOnce(neighbours, {start, end}, stretch, row);
        at = std::max(stop, at + 1);
    }
    return framesTold;
}

/// Reads the entries of `neighbours` inside `window`, holes between them included, in one go.
bool FamilyMember::readAtOnce(std::span<const MemberMapping> neighbours, AddressRange window,
                              MemberStretch& stretch, WindowRow& row) const {
    const std::uint64_t from = std::max(window.start, neighbours.front().range.start);
    const std::uint64_t to = std::min(window.end, neighbours.back().range.end);
    const std::span<PageKey> entries =
        std::span(row.keys).subspan((from - window.start) / basePage, (to - from) / basePage);
    if (readPagemapEntries(files_.pagemap, from, entries) != entries.size()) {
        std::fill(entries.begin(), entries.end(), 0);
        stretch.breakOff(ESRCH, neighbours.front().index);
        return true;
    }
    PageRecorder recorder(std::span(space_.mappings).subspan(stretch.firstMapping), &stretch.states);
    const PageRunSink record = [&](const FoundRun& run) {
        recorder.record(run.mapping - stretch.firstMapping, run.start, run.end, run.kind);
    };
    RunJoiner runs(record);
    const std::uint64_t zero = zeroFrame();
    bool framesTold = true;
    PageKey anyKey = 0;
    auto entry = entries.begin();
    std::uint64_t address = from;
    for (const MemberMapping& mapping : neighbours) {
        for (; address < mapping.range.start; address += basePage) {
            *entry++ = 0; // a hole, or what is not private
        }
        const bool isAnonymous = space_.mappings[mapping.index].isPrivateAnonymous();
        const std::uint64_t end = std::min(to, mapping.range.end);
        for (; address < end; address += basePage, ++entry) {
            const auto kind = source_->memoryOf(kindOfPagemapEntry(*entry, isAnonymous, zero));
            if (kind) {
                runs.add(mapping.index, address, *kind);
            }
            *entry = kind && *kind != PageKind::object ? keyOf(*entry, number_, &framesTold) : 0;
            anyKey |= *entry;
        }
    }
    row.holds = anyKey != 0 ? WindowRow::Holds::pages : row.holds;
    return framesTold;
}

bool FamilyMember::readFrames(std::uint64_t start, MemberStretch& stretch, WindowRow& row) const {
    const std::uint64_t end = start + windowBytes;
    bool framesTold = true;
    std::array<std::uint64_t, windowPages> entries;
    const std::span<const FoundRun> asked(stretch.asked);
    for (std::size_t at = stretch.nextAsked; at < asked.size() && asked[at].start < end;) {
        std::size_t stop = at + 1;
        while (stop < asked.size() && asked[stop].start < end &&
               areClose({asked[stop - 1].start, asked[stop - 1].end}, {asked[stop].start, asked[stop].end})) {
            ++stop;
        }
        const std::uint64_t from = std::max(start, asked[at].start);
        const std::uint64_t to = asked[at].isHuge ? from + basePage : std::min(end, asked[stop - 1].end);
        errno = 0;
        const std::size_t count =
            readPagemapEntries(files_.pagemap, from, std::span(entries).first((to - from) / basePage));
        if (count == 0 && errno != 0) {
            stretch.breakOff(errno, asked[at].mapping);
            return framesTold;
        }
        if (count != 0 && asked[at].isHuge) {
            row.keys[0] = keyOf(entries[0], number_, &framesTold);
            row.holds = WindowRow::Holds::hugePage;
            return framesTold;
        }
        for (; at < stop; ++at) {
            for (std::uint64_t address = std::max(from, asked[at].start);
                 address < std::min(asked[at].end, from + count * basePage); address += basePage) {
                if (address < end) {
                    row.keys[(address - start) / basePage] =
                        keyOf(entries[(address - from) / basePage], number_, &framesTold);
                }
            }
        }
    }
    return framesTold;
}

void FamilyMember::append(const MemberStretch& stretch) {
    if (!isReadable()) {
        return; // it has ended below these addresses
    }
    space_.status = stretch.status;
    for (std::size_t i = 0; i < stretch.states.mappings.size(); ++i) {
        space_.states.append(stretch.firstMapping + i, stretch.states, i);
    }
    if (!isReadable()) {
        space_.states.mappings.resize(stretch.firstMapping + stretch.states.mappings.size());
    }
}

} // namespace tally::platform
