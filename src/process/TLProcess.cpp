#include "process/TLProcess.h"

#include "base/Format.h"
#include "process/TLKernelProcess.h"
#include "process/TLUserProcess.h"
#include "vm/PhysTallyCollection.h"

#include <algorithm>

namespace tally {

using namespace platform;

std::shared_ptr<TLProcess> TLProcess::processWithPid(std::int32_t pid, kern_return_t* refusal) {
    if (refusal != nullptr) {
        *refusal = KERN_SUCCESS;
    }
    proc_bsdinfo info;
    return proc_pidinfo(pid, &info) == sizeof info ? processWithBsdInfo(info, refusal) : nullptr;
}

std::shared_ptr<TLProcess> TLProcess::processWithBsdInfo(const proc_bsdinfo& info, kern_return_t* refusal) {
    if (refusal != nullptr) {
        *refusal = KERN_SUCCESS;
    }
    std::shared_ptr<TLProcess> process;
    if ((info.pbi_flags & PROC_FLAG_SYSTEM) != 0) {
        process = std::make_shared<TLKernelProcess>();
    } else {
        process = std::make_shared<TLUserProcess>();
    }
    process->refusal_ = refusal;
    const bool isReadable = process->initWithBsdInfo(info);
    process->refusal_ = nullptr;
    return isReadable ? process : nullptr;
}

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
