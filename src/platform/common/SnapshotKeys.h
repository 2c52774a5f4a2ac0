// The keys of a snapshot file, for its reader and its writer alike.

#pragma once

#include "platform/quarry.h"

#include <cstddef>
#include <cstdint>
#include <limits>
#include <type_traits>

namespace tally::platform {

inline constexpr const char* snapshotFormat = "heapsnap";
inline constexpr std::uint64_t snapshotVersion = 1;

/// A key of `Record` whose value is a number that is not negative.
template <typename Record>
struct NumberKey {
    const char* name;
    std::uint64_t most;
    bool isRequired;
    std::uint64_t (*get)(const Record&);
    void (*set)(Record&, std::uint64_t);
};

template <typename Record, auto Member>
constexpr NumberKey<Record> numberKey(const char* name, std::uint64_t most, bool isRequired = false) {
    return {name, most, isRequired,
            [](const Record& record) { return static_cast<std::uint64_t>(record.*Member); },
            [](Record& record, std::uint64_t value) {
                using Field = std::remove_reference_t<decltype(record.*Member)>;
                record.*Member = static_cast<Field>(value);
            }};
}

template <typename Record>
struct FlagKey {
    const char* name;
    bool isRequired;
    bool Record::*member;
};

// Far above every address that can be mapped, and so small that two of them can be added.
inline constexpr std::uint64_t snapshotHighest = std::uint64_t{1} << 62;
inline constexpr std::uint64_t snapshotAnyNumber = std::numeric_limits<std::uint64_t>::max();
// Regions count their pages in 32 bits.
inline constexpr std::uint64_t snapshotMostPages = std::numeric_limits<std::uint32_t>::max();
inline constexpr std::uint64_t snapshotMostTally = std::numeric_limits<std::int64_t>::max();

inline constexpr NumberKey<QRYSnapshot> snapshotNumbers[] = {
    numberKey<QRYSnapshot, &QRYSnapshot::pid>("pid", 0x7FFFFFFF, true),
    numberKey<QRYSnapshot, &QRYSnapshot::vmPageSize>("page_size", 1 << 20, true),
    numberKey<QRYSnapshot, &QRYSnapshot::physicalTally>("phys_tally", snapshotMostTally, true),
    numberKey<QRYSnapshot, &QRYSnapshot::physicalTallyPeak>("phys_tally_peak", snapshotMostTally, true),
};
inline constexpr FlagKey<QRYSnapshot> snapshotFlags[] = {
    {"is_64bit", true, &QRYSnapshot::is64bit},
    {"is_translated", false, &QRYSnapshot::isTranslated},
    {"shows_phys_tally", true, &QRYSnapshot::showsPhysTally},
};

inline constexpr NumberKey<QRYVMRegion> snapshotRegionNumbers[] = {
    numberKey<QRYVMRegion, &QRYVMRegion::address>("address", snapshotHighest, true),
    numberKey<QRYVMRegion, &QRYVMRegion::length>("length", snapshotHighest, true),
    numberKey<QRYVMRegion, &QRYVMRegion::prot>("prot", 7),
    numberKey<QRYVMRegion, &QRYVMRegion::maxProt>("max_prot", 7),
    numberKey<QRYVMRegion, &QRYVMRegion::offset>("offset", snapshotAnyNumber), // a device's can be anywhere
    numberKey<QRYVMRegion, &QRYVMRegion::user_tag>("user_tag", 0xFFFFFFFF),
    numberKey<QRYVMRegion, &QRYVMRegion::resident_size>("resident_size", snapshotHighest),
    numberKey<QRYVMRegion, &QRYVMRegion::shared_now_private_size>("shared_now_private_size", snapshotHighest),
    numberKey<QRYVMRegion, &QRYVMRegion::swapped_out_size>("swapped_out_size", snapshotHighest),
    numberKey<QRYVMRegion, &QRYVMRegion::dirty_size>("dirty_size", snapshotHighest),
    numberKey<QRYVMRegion, &QRYVMRegion::reusable_size>("reusable_size", snapshotHighest),
    numberKey<QRYVMRegion, &QRYVMRegion::ref_count>("ref_count", 0xFFFF),
    numberKey<QRYVMRegion, &QRYVMRegion::external_pager>("external_pager", 1),
    numberKey<QRYVMRegion, &QRYVMRegion::share_mode>("share_mode", 8),
    numberKey<QRYVMRegion, &QRYVMRegion::object_id>("object_id", snapshotAnyNumber),
    numberKey<QRYVMRegion, &QRYVMRegion::purgeable>("purgeable", 3),
};
inline constexpr FlagKey<QRYVMRegion> snapshotRegionFlags[] = {
    {"is_submap", false, &QRYVMRegion::is_submap},
    {"is_wired", false, &QRYVMRegion::is_wired},
};

} // namespace tally::platform
