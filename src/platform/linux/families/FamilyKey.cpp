#include "platform/linux/families/FamilyKey.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"

#include <elf.h>
#include <linux/kcmp.h>
#include <sys/personality.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <string>

namespace tally::platform {

FamilyKey familyKeyOf(const ProcessStat& stat) {
    FamilyKey key{stat.layout};
    if (!key.isKnown() && stat.threads > 1) {
        for (const std::string& thread : threadFolders(stat.pid)) {
            const auto other = decodeStat(readSystemRecord(thread + "/stat").value_or(""));
            key = other ? FamilyKey{other->layout} : FamilyKey();
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
