// Memory analysis: snapshot files, and descriptions of VM tags that the tool's own table does not name.

#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace tally::platform {

/// A description of `tag`. Descriptions of unknown tags begin "Memory Tag". Thread-safe.
std::optional<std::string> QRYRegionTypeDescriptionForTag(std::uint32_t tag);

/// One region of a snapshot; sizes in bytes.
struct QRYVMRegion {
    std::uint64_t address = 0;
    std::uint64_t length = 0;
    std::string type;
    std::optional<std::string> path;
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
    int purgeable = 3;
};

/// The snapshot of one process.
class QRYProcessObjectGraph {
  public:
    virtual ~QRYProcessObjectGraph() = default;
    virtual std::int32_t pid() const = 0;
    virtual std::string processName() const = 0;
    virtual bool is64bit() const = 0;
    virtual std::string processDescriptionString() const = 0;
    virtual std::string binaryImagesDescription() const = 0;
    virtual std::uint32_t vmPageSize() const = 0; // bytes
    virtual std::uint64_t physicalTally() const = 0;
    virtual std::uint64_t physicalTallyPeak() const = 0;
    virtual bool showsPhysTally() const = 0;
    /// Calls `visitor` once per region in rising address order until it returns true.
    virtual void enumerateRegions(const std::function<bool(const QRYVMRegion&)>& visitor) const = 0;
};

/// Builds a snapshot from the complete contents of a file.
/// @return the snapshot; null when the contents are none, and then `*error` says why (it may stay empty).
std::unique_ptr<QRYProcessObjectGraph> QRYDirectedGraphWithData(std::string_view contents,
                                                                std::string* error);

} // namespace tally::platform
