#include "platform/linux/machine/ProcessStat.h"

#include "platform/linux/io/Pages.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <string>
#include <utility>

namespace tally::platform {

std::optional<ProcessStat> decodeStat(std::string_view text) {
    ProcessStat stat;
    // The command name stands in parentheses and may hold parentheses and blanks itself: it ends at the last
    // one.
    const std::size_t open = text.find('(');
    const std::size_t close = text.rfind(')');
    if (open == std::string_view::npos || close == std::string_view::npos || close < open) {
        return std::nullopt;
    }
    std::string_view head = text.substr(0, open);
    if (!takeNumber(head, &stat.pid)) {
        return std::nullopt;
    }
    stat.comm = text.substr(open + 1, close - open - 1);
    std::string_view rest = text.substr(close + 1);
    const std::string_view state = takeWord(rest);
    if (state.empty() || !takeNumber(rest, &stat.parent)) {
        return std::nullopt;
    }
    stat.state = state[0];
    constexpr int lastNeeded = 22;
    constexpr std::array<int, 6> addresses{26, 27, 28, 45, 46, 47};
    std::size_t known = 0;
    for (int field = 5; field <= addresses.back(); ++field) {
        bool valid = true;
        if (field == 9) {
            valid = takeNumber(rest, &stat.flags);
        } else if (field == 20) {
            valid = takeNumber(rest, &stat.threads);
        } else if (field == 22) {
            valid = takeNumber(rest, &stat.startTicks);
        } else if (field == 38) {
            valid = takeNumber(rest, &stat.exitSignal);
        } else if (field == addresses[known]) {
            valid = takeNumber(rest, &stat.layout[known++]);
        } else {
            valid = !takeWord(rest).empty();
        }
        if (!valid && field <= lastNeeded) {
            return std::nullopt;
        }
    }
    return stat;
}

namespace {

/// Reads a file of the folder of process `pid`; a folder that is not there is a process that does not exist.
std::optional<std::string> readProcessFile(std::int32_t pid, const char* name) {
    std::optional<std::string> text = readSystemRecord(processFolder(pid) + name);
    if (!text && errno == ENOENT) {
        errno = ESRCH;
    }
    return text;
}

} // namespace

std::optional<ProcessStat> readProcessStat(std::int32_t pid) {
    const std::optional<std::string> text = readProcessFile(pid, "/stat");
    if (!text) {
        return std::nullopt;
    }
    std::optional<ProcessStat> stat = decodeStat(*text);
    if (!stat) {
        errno = ESRCH; // an empty file: the process ended between open and read
    }
    return stat;
}

ProcessStatus decodeStatus(std::string_view text) {
    using Field = std::pair<std::string_view, std::uint64_t ProcessStatus::*>;
    static constexpr std::array<Field, 7> sizes{{
        {"VmHWM", &ProcessStatus::peakResident},
        {"VmLck", &ProcessStatus::locked},
        {"RssAnon", &ProcessStatus::residentAnonymous},
        {"RssShmem", &ProcessStatus::residentShared},
        {"VmPTE", &ProcessStatus::pageTables},
        {"VmSwap", &ProcessStatus::swapped},
        {"HugetlbPages", &ProcessStatus::hugetlb},
    }};
    ProcessStatus status;
    while (!text.empty()) {
        std::string_view key;
        std::uint64_t bytes = 0;
        if (!readRow(takeLine(text), &key, &bytes)) {
            continue;
        }
        for (const auto& [name, member] : sizes) {
            if (key == name) {
                status.*member = bytes;
                status.hasAddressSpace = true;
            }
        }
    }
    return status;
}

std::optional<ProcessStatus> readProcessStatus(std::int32_t pid) {
    const std::optional<std::string> text = readProcessFile(pid, "/status");
    std::optional<ProcessStatus> status = text ? std::optional(decodeStatus(*text)) : std::nullopt;
    if (!status || status->hasAddressSpace) {
        return status;
    }
    for (const std::string& thread : threadFolders(pid)) {
        const ProcessStatus other = decodeStatus(readSystemRecord(thread + "/status").value_or(""));
        if (other.hasAddressSpace) {
            return other;
        }
    }
    return status;
}

std::optional<std::uint64_t> readResidentAnonymous(std::int32_t pid) {
    const std::optional<std::string> text = readProcessFile(pid, "/statm");
    std::string_view rest = text ? std::string_view(*text) : std::string_view();
    std::array<std::uint64_t, 3> pages{}; // the address space, resident, and files and shared memory of these
    for (std::uint64_t& count : pages) {
        if (!takeNumber(rest, &count)) {
            return std::nullopt;
        }
    }
    return (pages[1] - std::min(pages[1], pages[2])) * basePage;
}

std::vector<std::string> threadFolders(std::int32_t pid) {
    const std::string parent = processFolder(pid) + "/task";
    std::vector<std::string> folders;
    for (const std::int32_t thread : listNumbered(parent).value_or(std::vector<std::int32_t>())) {
        if (thread != pid) {
            folders.push_back(parent + "/" + std::to_string(thread));
        }
    }
    return folders;
}

} // namespace tally::platform
