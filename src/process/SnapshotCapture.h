// SnapshotCapture: a running process as the contents of a snapshot file.
//
// The process is gathered as for a report, and its regions are written down as that gather sees them, so
// that a report of the snapshot says what one of the process would have said.

#pragma once

#include "platform/quarry.h"
#include "process/TLUserProcess.h"

namespace tally {

class SnapshotCapture final : public TLUserProcess {
  public:
    void enumerateRegions(const RegionCallback& callback) override;

    /// Whether the whole address space was read: the process may have ended on the way.
    bool isComplete() const { return isComplete_; }
    /// The snapshot, once the process has been gathered.
    platform::QRYSnapshot takeSnapshot();

  private:
    void addRegion(const EnumeratedRegion& mapping, const TLMemoryRegion& region);
    void addPartlyPresentRegion(const platform::QRYVMRegion& whole, const TLMemoryRegion& region);
    void addUnmappedMemory();

    std::vector<platform::QRYVMRegion> regions_;
    bool isComplete_ = false;
};

} // namespace tally
