#include "platform/linux/families/FamilyKey.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/processes/ProcessStat.h"

#include <elf.h>
#include <linux/kcmp.h>
#include <sys/personality.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <string>

namespace tally::platform {

FamilyKey decodeFamilyKey(std::string_view stat) {
    constexpr std::array<int, 6> fields{26, 27, 28, 45, 46, 47};
    FamilyKey key;
    const std::size_t close = stat.rfind(')');
    if (close == std::string_view::npos) {
        return key;
    }
    stat.remove_prefix(close + 1);
    std::size_t next = 0;
    for (int field = 3; next < fields.size(); ++field) {
        std::string_view word = takeWord(stat);
        if (word.empty()) {
            return FamilyKey();
        }
        if (field == fields[next]) {
            takeNumber(word, &key.layout[next++]);
        }
    }
    return key;
}

FamilyKey familyKeyOf(std::int32_t pid, const std::string& stat) {
    FamilyKey key = decodeFamilyKey(stat);
    const std::optional<ProcessStat> decoded = decodeStat(stat);
    if (!key.isKnown() && decoded && decoded->threads > 1) {
        for (const std::string& thread : threadFolders(pid)) {
            key = decodeFamilyKey(readSystemRecord(thread + "/stat").value_or(""));
            if (key.isKnown()) {
                break;
            }
        }
    }
    return key;
}

std::array<std::uint64_t, 2> readExecRandom(std::int32_t pid) {
    std::array<std::uint64_t, 2> bytes{};
    const std::string auxiliary = readSystemRecord(processFolder(pid) + "/auxv").value_or("");
    for (std::size_t at = 0; at + sizeof(Elf64_auxv_t) <= auxiliary.size(); at += sizeof(Elf64_auxv_t)) {
        Elf64_auxv_t entry;
        std::memcpy(&entry, auxiliary.data() + at, sizeof(entry));
        if (entry.a_type == AT_RANDOM) {
            // By this file and no other way: reading another process's memory directly would un-share its
            // pages.
            const Descriptor memory = openForReading(processFolder(pid) + "/mem");
            const ssize_t count =
                pread(memory.number(), bytes.data(), sizeof(bytes), static_cast<off_t>(entry.a_un.a_val));
            return count == sizeof(bytes) ? bytes : std::array<std::uint64_t, 2>{};
        }
    }
    return bytes;
}

bool isLayoutFixed(std::int32_t pid) {
    static const bool fixedForAll =
        readSystemFile(systemPath("/proc/sys/kernel/randomize_va_space")).value_or("2").starts_with('0');
    if (fixedForAll) {
        return true;
    }
    const std::string text = readSystemRecord(processFolder(pid) + "/personality").value_or("0");
    std::string_view rest = text;
    std::uint32_t flags = 0;
    takeNumber(rest, &flags, 16);
    return (flags & ADDR_NO_RANDOMIZE) != 0;
}

int compareAddressSpaces(std::int32_t a, std::int32_t b) {
    switch (syscall(SYS_kcmp, a, b, KCMP_VM, 0, 0)) {
    case 0:
        return 0;
    case 1:
        return -1;
    case 2:
        return 1;
    default:
        return incomparableAddressSpaces;
    }
}

} // namespace tally::platform
