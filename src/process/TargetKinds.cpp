// Which kind of target a process is, and which one a file holds.

#include "process/TLHeapsnapProcess.h"
#include "process/TLKernelProcess.h"
#include "process/TLUserProcess.h"

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

/// A snapshot is the one kind of file so far. Another one is told apart here, by what its first bytes are.
std::shared_ptr<TLProcess> TLProcess::processWithFile(const std::string& path,
                                                      std::optional<TLError>* error) {
    return processWithHeapsnap(path, error);
}

} // namespace tally
