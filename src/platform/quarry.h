// Memory analysis: snapshot files, and descriptions of VM tags that the tool's own table does not name.

#pragma once

#include "base/Name.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace tally::platform {

/// A description of `tag`. Descriptions of unknown tags begin "Memory Tag". Thread-safe.
std::optional<std::string> QRYRegionTypeDescriptionForTag(std::uint32_t tag);

/// The tag that is described as `description` in this run; makes one where there is none. Thread-safe.
std::uint32_t QRYTagForRegionTypeDescription(std::string_view description);

/// One region of a snapshot; sizes in bytes.
struct QRYVMRegion {
    std::uint64_t address = 0;
    std::uint64_t length = 0;
    Name type{}; // of an image segment: its name
    Name path{}; // of the mapped file or the image; absent: none
    std::int32_t prot = 0;
    std::int32_t maxProt = 0;
    std::uint64_t offset = 0;
    std::uint32_t user_tag = 0;
    std::uint64_t resident_size = 0;
    std::uint64_t shared_now_private_size = 0;
    std::uint64_t swapped_out_size = 0;
    std::uint64_t dirty_size = 0;
    std::uint64_t reusable_size = 0;
    std::uint16_t ref_count = 0;
    std::uint8_t external_pager = 0;
    std::uint8_t share_mode = 0;
    bool is_submap = false;
    std::uint64_t object_id = 0;
    bool is_wired = false;
    std::uint8_t purgeable = 3;
};

/// What a snapshot file holds.
struct QRYSnapshot {
    std::int32_t pid = 0;
    std::string processName{};
    bool is64bit = true;
    bool isTranslated = false;
    std::string architecture{};      // a word of QRYArchitectures; empty: not known
    std::string binaryImages{};      // description of the loaded images
    std::uint32_t vmPageSize = 4096; // bytes
    std::uint64_t physicalTally = 0;
    std::uint64_t physicalTallyPeak = 0;
    bool showsPhysTally = true;
    std::vector<QRYVMRegion> regions{}; // in rising address order
};

/// An architecture as a textual description of a process names it, and the range that the shared library
/// cache has there.
struct QRYArchitecture {
    std::string_view word;
    std::uint64_t cacheBase;
    std::uint64_t cacheSize; // bytes
};
/// Words that are part of others come after them.
inline constexpr QRYArchitecture QRYArchitectures[] = {
    {"X86-64", 0x7FF800000000, 0x7FE000000}, {"X86", 0x90000000, 0x20000000},
    {"ARM64_32", 0x1A000000, 0x40000000},    {"ARM64", 0x180000000, 0x100000000},
    {"ARM", 0x40000000, 0x40000000},
};
/// The first one that `processDescription` names; absent when it names none.
std::optional<QRYArchitecture> QRYArchitectureOf(std::string_view processDescription,
                                                 std::string_view binaryImages);

/// The word for the processes of this machine; empty where there is none.
std::string_view QRYHostArchitecture(bool is64bit);

/// The snapshot of one process.
class QRYProcessObjectGraph {
  public:
    explicit QRYProcessObjectGraph(QRYSnapshot snapshot) : snapshot_(std::move(snapshot)) {}

    std::int32_t pid() const { return snapshot_.pid; }
    const std::string& processName() const { return snapshot_.processName; }
    bool is64bit() const { return snapshot_.is64bit; }
    /// Names the architecture, and "(translated)" for a process that ran translated from another one.
    std::string processDescriptionString() const;
    const std::string& binaryImagesDescription() const { return snapshot_.binaryImages; }
    std::uint32_t vmPageSize() const { return snapshot_.vmPageSize; } // bytes
    std::uint64_t physicalTally() const { return snapshot_.physicalTally; }
    std::uint64_t physicalTallyPeak() const { return snapshot_.physicalTallyPeak; }
    bool showsPhysTally() const { return snapshot_.showsPhysTally; }
    /// Calls `visitor` once per region in rising address order until it returns true.
    void enumerateRegions(const std::function<bool(const QRYVMRegion&)>& visitor) const;

  private:
    QRYSnapshot snapshot_;
};

/// No snapshot file is larger.
inline constexpr std::uint64_t QRYLargestSnapshotFile = std::uint64_t{256} << 20;

/// Builds a snapshot from the complete contents of a file. Its architecture is one where no region lies in
/// the range of the shared library cache: for a process that has one there, another is named, or none.
/// @return the snapshot; null when the contents are none, and then `*error` says why (it may stay empty).
std::unique_ptr<QRYProcessObjectGraph> QRYDirectedGraphWithData(std::string_view contents,
                                                                std::string* error);

/// The contents of a file for `snapshot`, whose regions must rise without overlapping.
std::string QRYDataWithSnapshot(const QRYSnapshot& snapshot);

} // namespace tally::platform
