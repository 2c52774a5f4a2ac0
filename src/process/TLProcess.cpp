#include "process/TLProcess.h"

#include "base/Format.h"
#include "vm/PhysTallyCollection.h"

#include <algorithm>

namespace tally {

using namespace platform;

bool TLProcess::initWithBsdInfo(const proc_bsdinfo& info) {
    pid_ = static_cast<std::int32_t>(info.pbi_pid);
    is64bit_ = (info.pbi_flags & PROC_FLAG_LP64) != 0;
    if (!_populateTask()) {
        return false;
    }
    name_ = nameForBsdInfo(info);
    displayString_ = formatted("%s [%d]", name_.c_str(), pid_);
    pageSize_ = _gatherPageSize();
    return true;
}

bool TLProcess::breakDownPhysTally() const { return physTallyCollectionEnabled(); }

std::uint64_t TLProcess::_gatherPageSize() const { return vm_kernel_page_size(); }

void TLProcess::replaceWarning(const std::string& warning, const std::string& text) {
    const auto found = std::ranges::find(warnings_, warning);
    if (found != warnings_.end() && text.empty()) {
        warnings_.erase(found);
    } else if (found != warnings_.end()) {
        *found = text;
    }
}

void TLProcess::setMemoryRegions(RegionList regions) {
    memoryRegions_ = std::move(regions);
    hasMemoryRegions_ = true;
}

std::string TLProcess::description() const { return formatted("TLProcess[%d]", pid_); }

void TLProcess::recordRefusal(const char* label, kern_return_t status) {
    if (refusal_ != nullptr) {
        *refusal_ = status;
    } else {
        mach_error(label, status);
    }
}

} // namespace tally
