#include "platform/linux/families/FamilyScan.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/walk/PageSource.h"
#include "platform/linux/walk/PagemapEntry.h"
#include "platform/linux/walk/SmapsOfProcess.h"

#include <algorithm>
#include <cerrno>
#include <memory>
#include <optional>

namespace tally::platform {

namespace {

constexpr std::uint64_t windowBytes = 4 << 20;

/// A run of a member's own pages in the window that is being read.
struct OwnRun {
    std::uint64_t start = 0; // addresses
    std::uint64_t end = 0;
};

/// One member while its family is read.
class MemberScan {
  public:
    explicit MemberScan(MemberIdentity identity) : identity_(identity) {
        space_.status = files_.open(identity.pid, identity.startTicks, &space_.mappings);
        space_.folder = files_.folder;
        files_.maps = Descriptor(); // one descriptor a member is enough
        smaps_.emplace(files_.folder);
        source_.emplace(files_, space_.mappings, *smaps_, PageDetail::positions);
        recorder_.emplace(space_.mappings, &space_.states);
        privateMappings_ = tally::platform::privateMappings(space_.mappings);
    }

    bool isReadable() const { return space_.status == KERN_SUCCESS; }
    const std::vector<Mapping>& mappings() const { return space_.mappings; }
    const std::vector<MemberMapping>& privateMappings() const { return privateMappings_; }
    const std::vector<OwnRun>& ownRuns() const { return ownRuns_; }

    /// Reads the mappings that no relative can share page by page.
    void readSharedMappings() {
        for (std::size_t at = 0; isReadable() && at < space_.mappings.size();) {
            std::size_t end = at;
            while (end < space_.mappings.size() && !space_.mappings[end].isPrivate()) {
                ++end;
            }
            if (end > at) {
                read(at, end, {0, ~std::uint64_t{0}});
            }
            at = end + 1;
        }
    }

    /// Reads the private mappings inside `window`, and notes the runs of the member's own pages there.
    void readWindow(AddressRange window) {
        ownRuns_.clear();
        while (cursor_ < privateMappings_.size() && privateMappings_[cursor_].range.end <= window.start) {
            ++cursor_;
        }
        for (std::size_t at = cursor_;
             isReadable() && at < privateMappings_.size() && privateMappings_[at].range.start < window.end;) {
            // Private mappings side by side are read in one go.
            std::size_t next = at + 1;
            while (next < privateMappings_.size() && privateMappings_[next].range.start < window.end &&
                   privateMappings_[next].index == privateMappings_[next - 1].index + 1) {
                ++next;
            }
            read(privateMappings_[at].index, privateMappings_[next - 1].index + 1, window);
            at = next;
        }
    }

    /// The first page at or above `address`, after a window with pages of the member's own simply `address`.
    std::uint64_t nextPage(std::uint64_t address) {
        if (!isReadable() || privateMappings_.empty() || privateMappings_.back().range.end <= address) {
            return ~std::uint64_t{0};
        }
        if (!ownRuns_.empty()) {
            return address;
        }
        PageRegion first;
        while (address < privateMappings_.back().range.end) {
            PageScanStep step;
            if (scanPages(files_.pagemap.number(), address, privateMappings_.back().range.end, false,
                          std::span(&first, 1), &step) != 0) {
                return address;
            }
            if (!step.regions.empty()) {
                return std::max(address, first.start);
            }
            address = step.resume;
        }
        return address;
    }

    /// Writes the keys of the member's own pages in the window from `start` on to every `stride`-th place of
    /// `keys`.
    /// @return false when the frames are hidden.
    bool readKeys(std::uint64_t start, std::vector<PageKey>& keys, std::size_t member, std::size_t stride) {
        bool framesTold = true;
        entries_.resize((ownRuns_.back().end - ownRuns_.front().start) / basePage);
        const std::uint64_t first = ownRuns_.front().start;
        entries_.resize(readPagemapEntries(files_.pagemap, first, entries_));
        for (const OwnRun& run : ownRuns_) {
            for (std::uint64_t address = run.start; address < run.end; address += basePage) {
                const std::size_t at = (address - first) / basePage;
                if (at >= entries_.size()) {
                    return framesTold; // the process has ended: what is left is nobody's
                }
                keys[(address - start) / basePage * stride + member] =
                    keyOf(entries_[at], member, &framesTold);
            }
        }
        return framesTold;
    }

    AddressSpace takeSpace(bool isEstimated) {
        space_.isEstimated = isEstimated;
        return std::move(space_);
    }

  private:
    void read(std::size_t first, std::size_t end, AddressRange window) {
        const auto sink = [&](std::size_t index, std::uint64_t start, std::uint64_t stop, PageKind kind) {
            recorder_->record(index, start, stop, kind);
            if (kind != PageKind::object && space_.mappings[index].isPrivate()) {
                if (!ownRuns_.empty() && ownRuns_.back().end == start) {
                    ownRuns_.back().end = stop;
                } else {
                    ownRuns_.push_back({start, stop});
                }
            }
        };
        std::size_t reached = first;
        const int error = source_->read(first, end, window, sink, &reached);
        if (error != 0) {
            space_.status = error == ESRCH ? KERN_INVALID_ARGUMENT : KERN_FAILURE;
            space_.states.mappings.resize(reached);
        }
    }

    /// Without frames, pages at one address that the kernel does not call exclusive are taken for one page.
    static PageKey keyOf(std::uint64_t entry, std::size_t member, bool* framesTold) {
        const std::uint64_t place = entry & pagemap::place;
        if ((entry & (pagemap::present | pagemap::swapped)) == 0 || (entry & pagemap::file) != 0) {
            return 0;
        }
        if ((entry & pagemap::swapped) != 0) {
            return place != 0 ? place : 0;
        }
        if (place != 0) {
            return residentKey | place;
        }
        *framesTold = false;
        return residentKey | ((entry & pagemap::exclusive) != 0 ? member + 1 : 0);
    }

    MemberIdentity identity_;
    ProcessMemoryFiles files_;
    AddressSpace space_;
    std::optional<SmapsOfProcess> smaps_;
    std::optional<PageSource> source_;
    std::optional<PageRecorder> recorder_;
    std::vector<MemberMapping> privateMappings_;
    std::size_t cursor_ = 0;
    std::vector<OwnRun> ownRuns_;
    std::vector<std::uint64_t> entries_;
};

using Members = std::vector<std::unique_ptr<MemberScan>>;

/// Reads one window of all members and enters its pages into `sets`; `slot` is the first one that reaches
/// into it.
/// @return false when the frames are hidden.
bool scanWindow(AddressRange window, std::span<const AddressSlot> slots, std::size_t slot, Members& members,
                SharingSets& sets) {
    std::vector<std::uint32_t> owners; // members with pages of their own
    for (std::size_t i = 0; i < members.size(); ++i) {
        members[i]->readWindow(window);
        if (!members[i]->ownRuns().empty()) {
            owners.push_back(static_cast<std::uint32_t>(i));
        }
    }
    if (owners.size() < 2) {
        return true;
    }
    bool framesTold = true;
    std::vector<PageKey> keys((window.end - window.start) / basePage * owners.size());
    for (std::size_t i = 0; i < owners.size(); ++i) {
        framesTold &= members[owners[i]]->readKeys(window.start, keys, i, owners.size());
    }
    for (; slot < slots.size() && slots[slot].start < window.end; ++slot) {
        const std::uint64_t end = std::min(slots[slot].end, window.end);
        for (std::uint64_t address = std::max(slots[slot].start, window.start); address < end;
             address += basePage) {
            const std::size_t at = (address - window.start) / basePage * owners.size();
            sets.addPage(slot, owners, std::span(keys).subspan(at, owners.size()));
        }
    }
    return framesTold;
}

/// Where to read on after a window that ends at `end`: there, or, when that window was empty, at the next
/// page of any member: reservations can be a thousand times larger than what is in them.
std::uint64_t nextPageOfAny(Members& members, std::uint64_t end) {
    std::uint64_t next = ~std::uint64_t{0};
    for (const auto& member : members) {
        next = std::min(next, member->nextPage(end));
        if (next == end) {
            break;
        }
    }
    return next / basePage * basePage;
}

} // namespace

std::vector<AddressSpace> scanFamily(std::uint64_t familyKey, std::span<const MemberIdentity> identities) {
    allowDescriptors(identities.size());
    Members members;
    std::vector<AddressRange> ranges;
    for (const MemberIdentity& identity : identities) {
        members.push_back(std::make_unique<MemberScan>(identity));
        for (const MemberMapping& mapping : members.back()->privateMappings()) {
            ranges.push_back(mapping.range);
        }
        members.back()->readSharedMappings();
    }
    const std::vector<AddressSlot> slots = addressSlots(ranges);
    SharingSets sets(members.size());
    bool framesTold = true;
    std::uint64_t read = 0; // everything below this address
    for (std::size_t slot = 0; slot < slots.size();) {
        const std::uint64_t start = std::max(read, slots[slot].start);
        const AddressRange window{start, (start / windowBytes + 1) * windowBytes};
        framesTold &= scanWindow(window, slots, slot, members, sets);
        read = std::max(window.end, nextPageOfAny(members, window.end));
        while (slot < slots.size() && slots[slot].end <= read) {
            ++slot;
        }
    }

    const std::vector<SetPages> counts = sets.takeCounts();
    std::vector<std::vector<MemberMapping>> mappings;
    for (const auto& member : members) {
        mappings.push_back(member->privateMappings());
    }
    const std::vector<char> isImage = imageClusters(slots, mappings);
    std::vector<std::vector<SharedPart>> parts =
        sharedParts({familyKey, identities, slots, sets.sets(), counts, isImage}, mappings);
    std::vector<AddressSpace> spaces;
    for (std::size_t i = 0; i < members.size(); ++i) {
        spaces.push_back(members[i]->takeSpace(!framesTold));
        spaces.back().parts = std::move(parts[i]);
    }
    return spaces;
}

} // namespace tally::platform
