// The images of a task: the ELF files among its mappings, and the pages of code that the kernel gives it.

#include "platform/linux/images/ImageSegments.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/objects/Backing.h"
#include "platform/linux/walk/Task.h"
#include "platform/runekit.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

constexpr const char* kernelCode = "[vdso]";

/// Whether an image made so far covers the mapping: its code can be several mappings.
bool isCovered(const std::vector<std::pair<std::uint64_t, std::uint64_t>>& covered, const Mapping& mapping) {
    return std::any_of(covered.begin(), covered.end(), [&](const auto& range) {
        return range.first <= mapping.start && mapping.end <= range.second;
    });
}

} // namespace

void RKForeachSymbolOwner(mach_port_t port, const std::function<void(const RKSymbolOwner&)>& handler) {
    const std::shared_ptr<Task> task = taskOfPort(port);
    kern_return_t status = KERN_SUCCESS;
    const Walk* walk = task ? task->walk(&status) : nullptr;
    if (walk == nullptr) {
        return; // the walk of the regions meets that too, and reports it
    }
    std::vector<std::pair<std::uint64_t, std::uint64_t>> text; // address ranges of the images' code
    for (const Mapping& mapping : walk->mappings()) {
        if (mapping.name == kernelCode) {
            handler({kernelCode, mapping.start, {{mapping.start, mapping.size(), "__TEXT"}}});
        }
        if (!mapping.executable || !mapping.isFileBacked() || isCovered(text, mapping)) {
            continue;
        }
        // A file in memory is shared memory first of all: its pages are dirty, whoever maps them.
        const BackingObject object = backingOf(mapping, walk->folder());
        if (object.backing != Backing::file) {
            continue;
        }
        const auto layout = layoutOfFile(object, walk->folder(), mapping);
        const auto bias = layout ? biasOf(*layout, mapping) : std::nullopt;
        if (!bias) {
            continue;
        }
        RKSymbolOwner owner{mapping.name, *bias + layout->loads.front().firstPage(),
                            segmentsOf(*layout, *bias, mapping, walk->mappings())};
        for (const RKSegment& segment : owner.segments) {
            if (segment.name == "__TEXT") {
                text.emplace_back(segment.start, segment.start + segment.size);
            }
        }
        handler(owner);
    }
}

// The kernel lists files by the paths that they were found at in the end, as the task sees them.
std::string RKResolvedPath(mach_port_t /*task*/, std::string_view path) { return std::string(path); }

} // namespace tally::platform
