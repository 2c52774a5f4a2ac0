// A live process of the scripted kernel, and the regions of its walk as lines of text.

#pragma once

#include "base/Format.h"
#include "platform/scripted/ScriptedKernel.h"
#include "process/TLUserProcess.h"
#include "vm/PhysTallyCollection.h"
#include "vm/TLRangeList.h"

#include <gtest/gtest.h>

#include <string>
#include <tuple>
#include <vector>

namespace tally {

using Lines = std::vector<std::string>;

/// "start+size name" in hex, then what is not 0 of d(irty), s(wapped), c(lean), r(eclaimable) and w(ired).
inline std::string describeRange(const std::string& start, std::uint64_t size, const std::string& name,
                                 const TLRangeSizes& sizes) {
    std::string text = start + formatted("+%lx", size) + name;
    const std::uint64_t numbers[] = {sizes.dirty, sizes.swapped, sizes.clean, sizes.reclaimable, sizes.wired};
    for (std::size_t i = 0; i < std::size(numbers); ++i) {
        text += numbers[i] == 0 ? "" : formatted(" %c%lx", "dscrw"[i], numbers[i]);
    }
    return text;
}

/// A region; "@2" is a piece of the shared cache of segment 2, "#2" another region of segment 2.
inline std::string describe(const TLMemoryRegion& region) {
    const TLRangeSizes sizes{region.dirtySize, region.swappedSize, region.cleanNonSpecSize,
                             region.reclaimableSize, region.wired ? region.size : 0};
    std::string text = describeRange(region.start == TLNotSet ? "unmapped" : formatted("%lx", region.start),
                                     region.size, " " + region.fullName(), sizes);
    const int segment = static_cast<int>(region.segment);
    text += region.inSharedCache ? formatted(" @%d", segment) : segment > 1 ? formatted(" #%d", segment) : "";
    text += region.unusedSharedCacheRegion ? " gap" : "";
    text += region.ownedExclusivelyByParentProcess ? " owned" : "";
    return text + (region.verbose ? " verbose" : "");
}

/// A kernel with one task, 7, and the accounting switch on.
class WalkTest : public testing::Test {
  protected:
    struct Process final : TLUserProcess {
        bool _isAlive() const override { return alive; }
        using TLUserProcess::makeWalk;
        bool alive = true;
    };

    WalkTest() { setPhysTallyCollectionEnabled(1); }

    /// Makes the process of task 7 and gathers it. @return its regions, which stay until the next walk.
    const std::vector<TLMemoryRegion>& walk(bool hidden = false, bool alive = true) {
        process = std::make_unique<Process>();
        process->alive = alive;
        platform::proc_bsdinfo info;
        platform::proc_pidinfo(7, &info);
        process->initWithBsdInfo(info);
        process->setHiddenFromDisplay(hidden);
        process->gatherData();
        return process->memoryRegions();
    }

    /// The same as lines, and after them the warnings.
    Lines walkedLines(bool hidden = false, bool alive = true) {
        Lines lines;
        for (const TLMemoryRegion& region : walk(hidden, alive)) {
            lines.push_back(describe(region));
        }
        lines.insert(lines.end(), process->warnings().begin(), process->warnings().end());
        return lines;
    }

    platform::ScriptedKernel kernel;
    platform::ScriptedTask& task = kernel.addTask({.pid = 7, .name = "p"});
    std::unique_ptr<Process> process;
};

} // namespace tally
