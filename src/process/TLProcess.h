// TLProcess: the base of every analysed target.
//
// Holds a target's identity, the facts that every report needs, its regions once gathered, and the problems
// met on the way. A target kind overrides the hooks. Made on one thread, gathered once by one thread, then
// only read.

#pragma once

#include "base/TLError.h"
#include "platform/bsd_process.h"
#include "platform/kern_return.h"
#include "process/TLAuxData.h"
#include "vm/MemoryHolder.h"
#include "vm/TLMemoryRegion.h"
#include "vm/TLSharedCache.h"

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace tally {

/// What is known of a process's readiness to be ended when idle.
enum class TLIdleExitStatus : std::int32_t { unknown = 0, notTracked = 1, clean = 2, dirty = 3 };

class TLProcess : public MemoryHolder {
  public:
    using RegionList = std::vector<TLMemoryRegion>;

    TLProcess() = default;
    TLProcess(const TLProcess&) = delete;
    TLProcess& operator=(const TLProcess&) = delete;

    /// The process of `pid`; null when it does not exist or cannot be read. `refusal` as below.
    static std::shared_ptr<TLProcess> processWithPid(std::int32_t pid,
                                                     platform::kern_return_t* refusal = nullptr);
    /// The right kind of process for `info`; null when it cannot be read. The kernel's refusal goes to
    /// `refusal` where that is given (KERN_SUCCESS: there was none), else to standard error.
    static std::shared_ptr<TLProcess> processWithBsdInfo(const platform::proc_bsdinfo& info,
                                                         platform::kern_return_t* refusal = nullptr);
    /// The target that the file `path` holds; null, with the reason in `error`, when it holds none.
    static std::shared_ptr<TLProcess> processWithFile(const std::string& path, std::optional<TLError>* error);
    /// The last component of the executable's path, else a name from the record, else "Unknown". Thread-safe.
    static std::string nameForBsdInfo(const platform::proc_bsdinfo& info);

    /// Takes the identity from `info` and obtains what the kind needs to read the target.
    /// @return false when that fails; the object is of no use then.
    virtual bool initWithBsdInfo(const platform::proc_bsdinfo& info);
    /// Collects the regions, or the problems met instead.
    virtual void gatherData() {}
    /// Auxiliary data; absent when the kind has none to tell now.
    virtual std::optional<TLAuxDictionary> auxData() const { return TLAuxDictionary(); }
    bool breakDownPhysTally() const override;

    std::int32_t pid() const override { return pid_; }
    void setPid(std::int32_t pid) { pid_ = pid; }
    bool is64bit() const { return is64bit_; }
    void setIs64bit(bool is64bit) { is64bit_ = is64bit; }
    bool isTranslated() const { return isTranslated_; }
    void setIsTranslated(bool isTranslated) { isTranslated_ = isTranslated; }
    TLIdleExitStatus idleExitStatus() const { return idleExitStatus_; }
    const std::shared_ptr<const TLSharedCache>& sharedCache() const { return sharedCache_; }
    void setSharedCache(std::shared_ptr<const TLSharedCache> cache) { sharedCache_ = std::move(cache); }
    std::vector<std::string> errors() const { return errors_; } // a copy
    bool hasErrors() const { return !errors_.empty(); }
    const std::vector<std::string>& warnings() const { return warnings_; }
    const std::vector<std::string>& globalErrors() const { return globalErrors_; }
    bool hiddenFromDisplay() const { return hiddenFromDisplay_; }
    void setHiddenFromDisplay(bool hidden) { hiddenFromDisplay_ = hidden; }
    const std::string& name() const { return name_; }
    void setName(std::string name) { name_ = std::move(name); }
    const std::string& displayString() const { return displayString_; }
    void setDisplayString(std::string text) { displayString_ = std::move(text); }
    std::uint64_t pageSize() const override { return pageSize_; }
    void setPageSize(std::uint64_t pageSize) { pageSize_ = pageSize; }

    /// Whether gatherData has left regions.
    bool hasMemoryRegions() const { return hasMemoryRegions_; }
    /// The regions, which stay where they are; an empty list when there are none.
    RegionList& memoryRegions() { return memoryRegions_; }
    const RegionList& memoryRegions() const { return memoryRegions_; }
    void setMemoryRegions(RegionList regions);

    std::int64_t asNumber() const { return pid_; }
    std::size_t hash() const { return static_cast<std::size_t>(pid_); }
    std::string description() const;

    void addWarning(std::string text) { warnings_.push_back(std::move(text)); }
    /// Adds a warning that other processes have as well, for a reason that is not theirs.
    void addMachineWarning(std::string text) {
        warnings_.push_back(machineWarnings_.emplace_back(std::move(text)));
    }
    /// Those that were added since the last call.
    std::vector<std::string> takeMachineWarnings() { return std::exchange(machineWarnings_, {}); }
    /// Puts `text` in the place of a warning; an empty one takes it away.
    void replaceWarning(const std::string& warning, const std::string& text);
    void addError(std::string text) { errors_.push_back(std::move(text)); }
    /// Adds a problem of the whole run; only after all workers have finished.
    void _addGlobalError(std::string text) { globalErrors_.push_back(std::move(text)); }

    // Hooks.
    virtual std::uint64_t _gatherPageSize() const;
    virtual bool _populateTask() { return false; }
    virtual bool _isAlive() const { return false; }

    friend bool operator==(const TLProcess& a, const TLProcess& b) { return a.pid_ == b.pid_; }

  protected:
    void setIdleExitStatus(TLIdleExitStatus status) { idleExitStatus_ = status; }
    /// Records that the kernel refused what the kind needs to read the target.
    void recordRefusal(const char* label, platform::kern_return_t status);

  private:
    std::int32_t pid_ = 0;
    bool is64bit_ = false;
    bool isTranslated_ = false;
    bool hiddenFromDisplay_ = false;
    bool hasMemoryRegions_ = false;
    platform::kern_return_t* refusal_ = nullptr; // who wants to know; only while the process is made
    TLIdleExitStatus idleExitStatus_ = TLIdleExitStatus::unknown;
    std::shared_ptr<const TLSharedCache> sharedCache_;
    std::vector<std::string> errors_;
    std::vector<std::string> warnings_;
    std::vector<std::string> machineWarnings_; // of these
    std::vector<std::string> globalErrors_;
    std::string name_;
    RegionList memoryRegions_;
    std::string displayString_;
    std::uint64_t pageSize_ = 0;
};

} // namespace tally
