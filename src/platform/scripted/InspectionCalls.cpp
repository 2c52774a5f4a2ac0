// What the closed libraries tell: the shared library cache, images, snapshots, tag descriptions; and the
// kernel's own memory.

#include "platform/dyld_inspection.h"
#include "platform/mach_kernel_memory.h"
#include "platform/quarry.h"
#include "platform/runekit.h"

#include "base/Format.h"
#include "platform/scripted/Answer.h"

#include <algorithm>

namespace tally::platform {

namespace {

class KernelSymbolicator final : public RKKernelSymbolicator {
  public:
    explicit KernelSymbolicator(std::vector<ScriptedKernelSymbol> symbols) : symbols_(std::move(symbols)) {}

    std::optional<std::string> symbolName(std::uint64_t address) const override {
        const ScriptedKernelSymbol* symbol = symbolAt(address);
        return symbol == nullptr ? std::nullopt : std::optional(symbol->name);
    }
    std::optional<SourceInfo> sourceInfo(std::uint64_t address) const override {
        const ScriptedKernelSymbol* symbol = symbolAt(address);
        return symbol == nullptr ? std::nullopt : symbol->source;
    }

  private:
    const ScriptedKernelSymbol* symbolAt(std::uint64_t address) const {
        const auto found = std::find_if(symbols_.begin(), symbols_.end(), [&](const auto& symbol) {
            return address - symbol.start < symbol.size;
        });
        return found == symbols_.end() ? nullptr : &*found;
    }

    std::vector<ScriptedKernelSymbol> symbols_;
};

} // namespace

std::optional<dyld_shared_cache> dyld_shared_cache_for_task(mach_port_t task, kern_return_t* process_status,
                                                            kern_return_t* snapshot_status) {
    const Answer answer("dyld_shared_cache_for_task", PortName{task});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        *process_status = answer.fault != 0 ? answer.fault : KERN_INVALID_ARGUMENT;
        return std::nullopt;
    }
    *process_status = scripted->cacheProcessStatus;
    *snapshot_status = scripted->cacheSnapshotStatus;
    const bool readable = *process_status == KERN_SUCCESS && *snapshot_status == KERN_SUCCESS;
    return readable ? scripted->sharedCache : std::nullopt;
}

void RKForeachSymbolOwner(mach_port_t task, const std::function<void(const RKSymbolOwner&)>& handler) {
    const Answer answer("RKForeachSymbolOwner", PortName{task});
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault == 0 && scripted != nullptr) {
        std::for_each(scripted->images.begin(), scripted->images.end(), handler);
    }
}

std::string RKResolvedPath(mach_port_t task, std::string_view path) {
    const Answer answer("RKResolvedPath", PortName{task}, {}, path);
    std::string unresolved(path);
    const ScriptedTask* scripted = answer.taskOfPort(task);
    if (answer.fault != 0 || scripted == nullptr) {
        return unresolved;
    }
    const auto found = scripted->resolvedPaths.find(unresolved);
    return found == scripted->resolvedPaths.end() ? unresolved : found->second;
}

std::unique_ptr<RKKernelSymbolicator> RKCreateKernelSymbolicator() {
    const Answer answer("RKCreateKernelSymbolicator");
    if (answer.fault != 0 || !answer.kernel.kernelSymbols) {
        return nullptr;
    }
    return std::make_unique<KernelSymbolicator>(*answer.kernel.kernelSymbols);
}

kern_return_t mach_memory_info(mach_memory_record* record) {
    const Answer answer("mach_memory_info");
    *record = answer.fault != 0 ? mach_memory_record() : answer.kernel.memory;
    return answer.fault;
}

std::map<std::uint64_t, std::string> copyLoadedModuleIdentifiers() {
    const Answer answer("copyLoadedModuleIdentifiers");
    return answer.fault != 0 ? std::map<std::uint64_t, std::string>() : answer.kernel.loadedModules;
}

std::optional<std::string> QRYRegionTypeDescriptionForTag(std::uint32_t tag) {
    const Answer answer("QRYRegionTypeDescriptionForTag", -1, {tag});
    if (answer.fault != 0) {
        return std::nullopt;
    }
    const auto found = answer.kernel.tagDescriptions.find(tag);
    return found == answer.kernel.tagDescriptions.end() ? formatted("Memory Tag %u", tag) : found->second;
}

std::uint32_t QRYTagForRegionTypeDescription(std::string_view description) {
    const Answer answer("QRYTagForRegionTypeDescription", -1, {}, description);
    auto& descriptions = answer.kernel.tagDescriptions;
    const auto known =
        std::ranges::find(descriptions, description, [](const auto& entry) { return entry.second; });
    if (known != descriptions.end()) {
        return known->first;
    }
    std::uint32_t tag = 100; // free in the tool's own table
    while (descriptions.contains(tag)) {
        ++tag;
    }
    descriptions.emplace(tag, description);
    return tag;
}

} // namespace tally::platform
