#include "platform/linux/families/FamilyScan.h"

#include "platform/linux/io/SystemFiles.h"

#include <algorithm>

namespace tally::platform {

namespace {

constexpr std::uint64_t nowhere = ~std::uint64_t{0};
const std::uint64_t stretchBytes = 8 * windowBytes;

} // namespace

FamilyScan::FamilyScan(std::uint64_t familyKey, std::span<const MemberIdentity> members)
    : familyKey_(familyKey), identities_(members.begin(), members.end()), members_(members.size()),
      nextPages_(members.size()) {
    allowDescriptors(members.size());
}

void FamilyScan::join() {
    std::unique_lock lock(mutex_);
    try {
        while (phase_ != Phase::done && !failure_) {
            work(lock);
        }
    } catch (...) {
        if (!lock.owns_lock()) {
            lock.lock();
        }
        failure_ = std::current_exception();
        changed_.notify_all();
    }
    if (failure_) {
        std::rethrow_exception(failure_);
    }
}

/// Does the next piece of work, without the lock meanwhile, or waits for others to end theirs.
void FamilyScan::work(std::unique_lock<std::mutex>& lock) {
    Stretch* stretch = nullptr;
    if (phase_ == Phase::opening && begun_ < members_.size()) {
        open(lock);
    } else if (phase_ == Phase::reading && (stretch = nextStretch()) != nullptr) {
        ++working_;
        lock.unlock();
        read(*stretch);
        lock.lock();
        --working_;
        for (const MemberStretch& member : stretch->read) {
            if (member.status != KERN_SUCCESS) {
                nextPages_[member.member] = nowhere; // there is nothing more to be had of it
            }
        }
    } else if (working_ != 0) {
        changed_.wait(lock);
        return;
    } else if (phase_ == Phase::opening) {
        std::vector<AddressRange> ranges;
        for (const auto& member : members_) {
            for (const MemberMapping& mapping : member->privateMappings()) {
                ranges.push_back(mapping.range);
            }
        }
        slots_ = addressSlots(ranges);
        phase_ = Phase::reading;
    } else {
        finish();
        phase_ = Phase::done;
    }
    changed_.notify_all();
}

void FamilyScan::open(std::unique_lock<std::mutex>& lock) {
    const std::size_t number = begun_++;
    ++working_;
    lock.unlock();
    auto member = std::make_unique<FamilyMember>(identities_[number], static_cast<std::uint32_t>(number));
    const std::uint64_t next = member->nextPage(0);
    lock.lock();
    --working_;
    members_[number] = std::move(member);
    nextPages_[number] = next;
}

/// The next windows that hold pages of a member; null when there are none.
FamilyScan::Stretch* FamilyScan::nextStretch() {
    const std::uint64_t next = *std::min_element(nextPages_.begin(), nextPages_.end());
    if (next == nowhere) {
        return nullptr;
    }
    auto stretch = std::make_unique<Stretch>();
    stretch->range = {next / windowBytes * windowBytes, (next / stretchBytes + 1) * stretchBytes};
    for (std::size_t i = 0; i < members_.size(); ++i) {
        if (nextPages_[i] < stretch->range.end) {
            stretch->read.push_back(members_[i]->begin(stretch->range));
            nextPages_[i] = members_[i]->nextPage(stretch->range.end);
        }
    }
    return stretches_.emplace_back(std::move(stretch)).get();
}

/// The first window from `address` on in which a member may have a page.
std::uint64_t FamilyScan::nextWindow(const Stretch& stretch, std::uint64_t address) const {
    std::uint64_t next = nowhere;
    for (const MemberStretch& member : stretch.read) {
        next = std::min(next, members_[member.member]->nextPage(member, address));
    }
    return next / windowBytes * windowBytes;
}

void FamilyScan::read(Stretch& stretch) const {
    stretch.sets.emplace(members_.size());
    std::vector<WindowRow> rows(stretch.read.size());
    bool wasShared = false; // the last window
    for (std::uint64_t start = nextWindow(stretch, stretch.range.start); start < stretch.range.end;
         start = nextWindow(stretch, start + windowBytes)) {
        std::vector<WindowRow*> holding;
        for (std::size_t i = 0; i < rows.size(); ++i) {
            const FamilyMember& member = *members_[stretch.read[i].member];
            stretch.framesTold &= member.readWindow(start, stretch.read[i], rows[i]);
            if (rows[i].holds != WindowRow::Holds::nothing) {
                holding.push_back(&rows[i]);
            }
        }
        wasShared = holding.size() > 1;
        if (!wasShared) {
            continue; // no relative shares what is there
        }
        for (std::size_t i = 0; i < rows.size(); ++i) {
            if (rows[i].holds != WindowRow::Holds::nothing) {
                stretch.framesTold &=
                    members_[stretch.read[i].member]->readFrames(start, stretch.read[i], rows[i]);
            }
        }
        compare(start, holding, *stretch.sets);
    }
    for (std::size_t i = 0; i < rows.size(); ++i) {
        stretch.read[i].asked = {};
        members_[stretch.read[i].member]->expect(stretch.range.end, wasShared ? &rows[i] : nullptr);
    }
}

/// Enters the pages of the window that begins at `start`.
void FamilyScan::compare(std::uint64_t start, std::span<WindowRow* const> rows, SharingSets& sets) const {
    using enum WindowRow::Holds;
    const bool allHuge =
        std::ranges::all_of(rows, [](const WindowRow* row) { return row->holds == hugePage; });
    std::vector<std::uint32_t> members;
    for (WindowRow* row : rows) {
        members.push_back(row->member);
        if (row->holds == hugePage && !allHuge) {
            row->writeOut();
        }
    }
    std::vector<PageKey> keys(rows.size());
    auto slot = std::upper_bound(slots_.begin(), slots_.end(), start,
                                 [](std::uint64_t address, const auto& each) { return address < each.end; });
    for (; slot != slots_.end() && slot->start < start + windowBytes; ++slot) {
        const std::size_t first = slot->start < start ? 0 : (slot->start - start) / basePage;
        const std::size_t end = std::min<std::uint64_t>(windowPages, (slot->end - start) / basePage);
        const std::size_t pages = allHuge ? end - first : 1;
        for (std::size_t page = first; page < end; page += pages) {
            for (std::size_t i = 0; i < rows.size(); ++i) {
                keys[i] = rows[i]->keys[allHuge ? 0 : page];
            }
            sets.addPages(static_cast<std::size_t>(slot - slots_.begin()), members, keys, pages);
        }
    }
}

/// Puts together what was found in all stretches.
void FamilyScan::finish() {
    SharingSets sets(members_.size());
    bool framesTold = true;
    for (const auto& stretch : stretches_) {
        framesTold &= stretch->framesTold;
        sets.absorb(*stretch->sets);
        for (const MemberStretch& read : stretch->read) {
            members_[read.member]->append(read);
        }
    }
    stretches_.clear();
    std::vector<std::vector<MemberMapping>> mappings;
    for (const auto& member : members_) {
        mappings.push_back(member->privateMappings());
    }
    const std::vector<SetPages> counts = sets.takeCounts();
    const std::vector<char> isImage = imageClusters(slots_, mappings);
    std::vector<std::vector<SharedPart>> parts =
        sharedParts({familyKey_, identities_, slots_, sets.sets(), counts, isImage}, mappings);
    for (std::size_t i = 0; i < members_.size(); ++i) {
        spaces_.push_back(members_[i]->takeSpace());
        spaces_.back().parts = std::move(parts[i]);
        spaces_.back().isEstimated = !framesTold;
    }
    members_.clear();
}

std::vector<AddressSpace> FamilyScan::takeSpaces() {
    const std::scoped_lock lock(mutex_);
    return std::move(spaces_);
}

} // namespace tally::platform
