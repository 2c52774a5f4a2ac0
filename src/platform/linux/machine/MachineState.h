// What the whole machine's counters say, read once per gather: whether figures that are dear to read can be
// other than 0 at all.

#pragma once

#include <cstdint>
#include <string_view>

namespace tally::platform {

/// What cannot be read is taken for what makes processes be asked themselves.
struct MachineState {
    bool swapInUse = false;
    bool mergesPages = false;     // pages of the same content are one (KSM)
    bool tellsMergedPages = true; // by process
    bool countersLag = false;     // those of resident memory, behind what each thread has touched
    // Bytes that processes have given up and the kernel may take, about; the most where that is not known.
    std::uint64_t lazyFree = 0;
};

/// Bytes of lazily freed memory by a vmstat text: such pages stand on the lists of inactive file pages, but
/// count as anonymous. Exact to what processors have not put on their lists yet.
std::uint64_t decodeLazyFree(std::string_view vmstat);

/// Whether any swap is in use, by a meminfo text.
bool decodeSwapInUse(std::string_view meminfo);

/// The state: that of the gather that is under way, else read now.
MachineState machineState();

} // namespace tally::platform
