// FamilyScan: reads a family of forked processes side by side and finds which pages they share.
//
// The idea: relatives that still share a page have the same frame at the same address, or the same place in
// swap. All members are read through one window of addresses before the next one. So memory does not grow
// with the family, and the kernel finds its records of shared pages in its caches. Windows without a page of
// any member are passed over.
//
// Frames are compared wherever two members have pages, even where the kernel says "mapped once": of a huge
// page that bit tells the first part only. Cost: a page table entry per page and member, one per huge page.

#pragma once

#include "platform/linux/families/FamilyMember.h"
#include "platform/linux/families/SharingSets.h"

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <vector>

namespace tally::platform {

/// Any number of threads may take part.
class FamilyScan {
  public:
    /// @param members rising by pid; no two share an address space.
    FamilyScan(std::uint64_t familyKey, std::span<const MemberIdentity> members);

    /// Takes part in the scan until it is done. What one thread throws, all throw.
    void join();
    /// The address spaces of all members, once it is done.
    std::vector<AddressSpace> takeSpaces();

  private:
    enum class Phase : std::uint8_t { opening, reading, done };

    /// Some windows, and what was found in them.
    struct Stretch {
        AddressRange range;
        std::vector<MemberStretch> read; // of the members that have pages there
        std::optional<SharingSets> sets;
        bool framesTold = true;
    };

    void work(std::unique_lock<std::mutex>& lock);
    void open(std::unique_lock<std::mutex>& lock);
    Stretch* nextStretch();
    std::uint64_t nextWindow(const Stretch& stretch, std::uint64_t address) const;
    void read(Stretch& stretch) const;
    void compare(std::uint64_t start, std::span<WindowRow* const> rows, SharingSets& sets) const;
    void finish();

    std::uint64_t familyKey_;
    std::vector<MemberIdentity> identities_;
    std::vector<AddressSlot> slots_;

    std::mutex mutex_; // guards what follows
    std::condition_variable changed_;
    Phase phase_ = Phase::opening;
    std::exception_ptr failure_;
    std::size_t begun_ = 0;   // members that are opened, or being opened
    std::size_t working_ = 0; // threads
    std::vector<std::unique_ptr<FamilyMember>> members_;
    std::vector<std::uint64_t> nextPages_; // of each member, above all stretches so far
    std::vector<std::unique_ptr<Stretch>> stretches_;
    std::vector<AddressSpace> spaces_;
};

} // namespace tally::platform
