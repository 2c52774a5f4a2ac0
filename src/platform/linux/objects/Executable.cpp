#include "platform/linux/objects/Executable.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/objects/FileInquiry.h"

#include <elf.h>

#include <cstring>
#include <limits>
#include <string_view>

namespace tally::platform {

namespace {

/// Files that programs were started from, whatever device they are on.
constexpr std::uint64_t executables = unknownDevice - 1;

/// The size of a program header, by which the kernel tells programs of the two classes where theirs are.
template <typename Entry>
std::uint64_t headerSize(const std::string& auxiliary) {
    for (std::size_t at = 0; at + sizeof(Entry) <= auxiliary.size(); at += sizeof(Entry)) {
        Entry entry;
        std::memcpy(&entry, auxiliary.data() + at, sizeof entry);
        if (entry.a_type == AT_PHENT) {
            return entry.a_un.a_val;
        }
    }
    return 0;
}

} // namespace

std::optional<std::string> executableLink(std::int32_t pid) {
    return readSystemLink(processFolder(pid) + "/exe");
}

std::string executablePath(std::int32_t pid, std::string link) {
    constexpr std::string_view deleted = " (deleted)";
    if (!link.ends_with(deleted)) {
        return link;
    }
    const bool hasName = !link.starts_with("/memfd:"); // which never have one
    const auto named = hasName ? inquire(executables, processFolder(pid) + "/root" + link) : std::nullopt;
    const auto running = named ? inquire(executables, processFolder(pid) + "/exe") : std::nullopt;
    const bool isOne = running && named->status.stx_ino == running->status.stx_ino &&
                       named->status.stx_dev_major == running->status.stx_dev_major &&
                       named->status.stx_dev_minor == running->status.stx_dev_minor;
    if (!isOne) {
        link.resize(link.size() - deleted.size());
    }
    return link;
}

std::optional<bool> decodeIs64bit(const std::string& auxiliary) {
    if (headerSize<Elf64_auxv_t>(auxiliary) == sizeof(Elf64_Phdr)) {
        return true;
    }
    if (headerSize<Elf32_auxv_t>(auxiliary) == sizeof(Elf32_Phdr)) {
        return false;
    }
    return std::nullopt;
}

bool is64bitProgram(const ProcessStat& process) {
    const std::uint64_t stack = process.layout[2];
    if (stack > std::numeric_limits<std::uint32_t>::max()) {
        return true;
    }
    // Not the file: it could be on a file system that does not answer.
    const auto auxiliary = readSystemRecord(processFolder(process.pid) + "/auxv");
    return decodeIs64bit(auxiliary.value_or("")).value_or(sizeof(void*) == 8);
}

} // namespace tally::platform
