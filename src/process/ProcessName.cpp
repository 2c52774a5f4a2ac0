// The name of a process: what its executable is called, else what its identity record says.

#include "process/TLProcess.h"

#include <algorithm>
#include <new>
#include <span>
#include <string_view>

namespace tally {

using namespace platform;

namespace {

/// Last component of the first path in an argument area, which begins with the argument count and NUL
/// padding. Empty when there is none.
std::string_view executableName(std::string_view area) {
    const std::size_t countEnd = area.find('\0');
    const std::size_t start = area.find_first_not_of('\0', countEnd);
    if (countEnd == std::string_view::npos || start == std::string_view::npos) {
        return {};
    }
    const std::string_view path = area.substr(start, area.find('\0', start) - start);
    return path.substr(path.rfind('/') + 1);
}

/// Name of the executable of `pid`; empty when it cannot be had.
std::string nameFromArgumentArea(std::int32_t pid) {
    std::uint64_t size = 0;
    if (sysctl_argmax(&size) != 0) {
        return {};
    }
    // Megabytes that are hardly used: not zeroed.
    const std::unique_ptr<char[]> buffer(new (std::nothrow) char[size]);
    if (!buffer) {
        return {};
    }
    const std::ptrdiff_t length = sysctl_procargs2(pid, std::span(buffer.get(), size));
    if (length <= 0) {
        return {};
    }
    buffer[length - 1] = '\0';
    return std::string(executableName({buffer.get(), static_cast<std::size_t>(length)}));
}

/// A text field that need not end in a NUL.
std::string textOfField(std::span<const char> field) {
    return {field.begin(), std::ranges::find(field, '\0')};
}

} // namespace

std::string TLProcess::nameForBsdInfo(const proc_bsdinfo& info) {
    for (std::string name : {nameFromArgumentArea(static_cast<std::int32_t>(info.pbi_pid)),
                             textOfField(info.pbi_name), textOfField(info.pbi_comm)}) {
        if (!name.empty()) {
            return name;
        }
    }
    return "Unknown";
}

} // namespace tally
