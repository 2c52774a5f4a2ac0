// Notices about what this kernel, or this user's rights, cost every process alike. A report tells each once.

#pragma once

#include <algorithm>
#include <array>
#include <string_view>

namespace tally::platform {

inline constexpr const char* pageCacheNotice =
    "The page cache could not be asked: shared memory and files are counted by the process's own page tables";
inline constexpr const char* sharingNotice =
    "Frame numbers are hidden: what is shared with forked relatives is estimated from addresses";
inline constexpr const char* corpseSharingNotice =
    "Frame numbers are hidden: what corpses of forked relatives share counts for each of them";
inline constexpr const char* untoldMergingNotice =
    "Pages are merged by their content (KSM) and count for every "
    "process that has them: this kernel does not tell whose";

inline bool isOfMachine(std::string_view notice) {
    constexpr std::array<std::string_view, 4> all{pageCacheNotice, sharingNotice, corpseSharingNotice,
                                                  untoldMergingNotice};
    return std::ranges::find(all, notice) != all.end();
}

} // namespace tally::platform
