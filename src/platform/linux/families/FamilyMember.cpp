#include "platform/linux/families/FamilyMember.h"

#include "platform/linux/walk/PageScan.h"
#include "platform/linux/walk/PagemapEntry.h"

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

bool isReadAtOnce(const Mapping& mapping) { return mapping.size() <= mostReadAtOnce && framesAreTold(); }

/// Whether reading on over the hole between two ranges is cheaper than another call.
bool areClose(const AddressRange& lower, const AddressRange& upper) {
    return upper.start - lower.end <= 64 * basePage;
}

/// Hands runs of pages of one state in one mapping on as a whole.
class RunJoiner {
  public:
    RunJoiner(PageRecorder& recorder, std::size_t firstMapping)
        : recorder_(recorder), firstMapping_(firstMapping) {}
    RunJoiner(const RunJoiner&) = delete;
    RunJoiner& operator=(const RunJoiner&) = delete;
    ~RunJoiner() { finish(); }

    void add(std::size_t mapping, std::uint64_t address, PageKind kind) {
        if (run_.mapping != mapping || run_.end != address || run_.kind != kind) {
            finish();
            run_ = {mapping, address, address, kind};
        }
        run_.end += basePage;
    }

  private:
    void finish() {
        if (run_.end != run_.start) {
            recorder_.record(run_.mapping - firstMapping_, run_.start, run_.end, run_.kind);
        }
    }

    PageRecorder& recorder_;
    std::size_t firstMapping_;
    FoundRun run_;
};

} // namespace

void MemberStretch::breakOff(int error, std::size_t mapping) {
    status = error == ESRCH ? KERN_INVALID_ARGUMENT : KERN_FAILURE;
    states.mappings.resize(mapping - firstMapping);
}

void WindowRow::writeOut() {
    for (std::size_t i = 1; i < keys.size(); ++i) {
        keys[i] = keys[0] + i;
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
    if (isReadable() && !scansAreAnswered()) {
        findPlaces();
    }
}

void FamilyMember::findPlaces() {
    const auto note = [&](const FoundRun& run) {
        for (std::uint64_t window = run.start / windowBytes * windowBytes; window < run.end;
             window += windowBytes) {
            if (places_.empty() || places_.back() < window) {
                places_.push_back(window);
            }
        }
    };
    for (const MemberMapping& mapping : privateMappings_) {
        std::size_t reached = 0;
        if (!isReadAtOnce(space_.mappings[mapping.index])) {
            source_->read(mapping.index, mapping.index + 1, {0, nowhere}, note, &reached);
        }
    }
}

std::uint64_t FamilyMember::nextPage(std::uint64_t address) const {
    auto at = std::upper_bound(
        privateMappings_.begin(), privateMappings_.end(), address,
        [](std::uint64_t wanted, const MemberMapping& mapping) { return wanted < mapping.range.end; });
    for (; isReadable() && at != privateMappings_.end(); ++at) {
        const Mapping& mapping = space_.mappings[at->index];
        const std::uint64_t from = std::max(address, mapping.start);
        const std::uint64_t next = isReadAtOnce(mapping) ? from : nextAskedPage(mapping, from);
        if (next < mapping.end) {
            return next;
        }
    }
    return nowhere;
}

std::uint64_t FamilyMember::nextAskedPage(const Mapping& mapping, std::uint64_t address) const {
    if (!scansAreAnswered()) {
        const auto place =
            std::lower_bound(places_.begin(), places_.end(), address / windowBytes * windowBytes);
        return place == places_.end() ? nowhere : std::max(address, *place);
    }
    return source_->nextPage(mapping, address);
}

/// The first mapping that ends above `address`.
std::vector<Mapping>::const_iterator FamilyMember::mappingAbove(std::uint64_t address) const {
    return std::upper_bound(
        space_.mappings.begin(), space_.mappings.end(), address,
        [](std::uint64_t wanted, const Mapping& mapping) { return wanted < mapping.end; });
}

void FamilyMember::expect(std::uint64_t end, const WindowRow* last) {
    const auto at = mappingAbove(end - 1);
    const bool isFull = last != nullptr && at != space_.mappings.end() && at->end > end && framesAreTold() &&
                        last->isFullOfPages();
    full_ = isFull ? static_cast<std::size_t>(at - space_.mappings.begin()) : MemberStretch::none;
}

MemberStretch FamilyMember::begin(AddressRange range) const {
    MemberStretch stretch;
    const auto startsBelow = [](const auto& mapping, std::uint64_t address) {
        return mapping.start < address;
    };
    const std::vector<Mapping>& all = space_.mappings;
    const auto first = mappingAbove(range.start);
    const auto end = std::lower_bound(first, all.end(), range.end, startsBelow);
    const auto indexOf = [&](auto at) { return static_cast<std::size_t>(at - all.begin()); };
    std::size_t reached = 0;
    stretch.member = number_;
    stretch.firstMapping = indexOf(first);
    stretch.states = PageStates(end - first);
    PageRecorder recorder(std::span(first, end), &stretch.states);
    const auto take = [&](const FoundRun& run) {
        recorder.record(run.mapping - stretch.firstMapping, run.start, run.end, run.kind);
        if (run.kind != PageKind::object) {
            stretch.asked.push_back(run);
        }
    };
    stretch.full = full_;
    const std::uint64_t fullStart = stretch.full == MemberStretch::none ? nowhere : all[stretch.full].start;
    const auto isAsked = [&](const Mapping& mapping) {
        return mapping.isPrivate() && !isReadAtOnce(mapping) && mapping.start != fullStart;
    };
    for (auto at = first; stretch.status == KERN_SUCCESS && at != end;) {
        at = std::find_if(at, end, isAsked);
        const auto stop = std::find_if_not(at, end, isAsked);
        const int error = at == stop ? 0 : source_->read(indexOf(at), indexOf(stop), range, take, &reached);
        if (error != 0) {
            stretch.breakOff(error, stretch.firstMapping); // what is read at once was not read yet
        }
        at = stop;
    }
    const auto next = std::lower_bound(
        privateMappings_.begin(), privateMappings_.end(), range.start,
        [](const MemberMapping& mapping, std::uint64_t address) { return mapping.range.end <= address; });
    stretch.nextMapping = static_cast<std::size_t>(next - privateMappings_.begin());
    return stretch;
}

bool FamilyMember::readWindow(std::uint64_t start, MemberStretch& stretch, WindowRow& row) const {
    row.member = number_;
    row.holds = WindowRow::Holds::nothing;
    row.keys.fill(0);
    const std::uint64_t end = start + windowBytes;
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
               (isReadAtOnce(space_.mappings[privateMappings_[stop].index]) ||
                privateMappings_[stop].index == stretch.full) &&
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
    RunJoiner runs(recorder, stretch.firstMapping);
    bool framesTold = true;
    auto entry = entries.begin();
    std::uint64_t address = from;
    for (const MemberMapping& mapping : neighbours) {
        for (; address < mapping.range.start; address += basePage) {
            *entry++ = 0; // a hole, or what is not private
        }
        const bool isAnonymous = space_.mappings[mapping.index].isPrivateAnonymous();
        for (; address < std::min(to, mapping.range.end); address += basePage, ++entry) {
            const auto kind = source_->memoryOf(kindOfPagemapEntry(*entry, isAnonymous));
            if (kind) {
                runs.add(mapping.index, address, *kind);
            }
            *entry = kind && *kind != PageKind::object ? keyOf(*entry, number_, &framesTold) : 0;
            row.holds = *entry != 0 ? WindowRow::Holds::pages : row.holds;
        }
    }
    return framesTold;
}

bool FamilyMember::readFrames(std::uint64_t start, const MemberStretch& stretch, WindowRow& row) const {
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
        const std::size_t count =
            readPagemapEntries(files_.pagemap, from, std::span(entries).first((to - from) / basePage));
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
