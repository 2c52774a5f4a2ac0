#include "platform/linux/pages/DecodeMaps.h"

#include "platform/linux/io/TextScan.h"

#include <array>
#include <utility>

namespace tally::platform {

namespace {

/// A newline in a path stands as "\012" in the text.
std::string unescaped(std::string_view name) {
    constexpr std::string_view escape = "\\012";
    std::string plain;
    for (std::size_t at = 0; at < name.size();) {
        if (name.substr(at, escape.size()) == escape) {
            plain += '\n';
            at += escape.size();
        } else {
            plain += name[at++];
        }
    }
    return plain;
}

std::uint64_t* sizeField(SmapsEntry& entry, std::string_view key) {
    static constexpr std::array<std::pair<std::string_view, std::uint64_t SmapsEntry::*>, 8> fields{{
        {"Rss", &SmapsEntry::resident},
        {"Anonymous", &SmapsEntry::anonymous},
        {"Swap", &SmapsEntry::swapped},
        {"LazyFree", &SmapsEntry::lazyFree},
        {"Shared_Dirty", &SmapsEntry::dirty},
        {"Private_Dirty", &SmapsEntry::dirty},
        {"Shared_Hugetlb", &SmapsEntry::hugetlb},
        {"Private_Hugetlb", &SmapsEntry::hugetlb},
    }};
    for (const auto& [name, member] : fields) {
        if (name == key) {
            return &(entry.*member);
        }
    }
    return nullptr;
}

void decodeSmapsField(std::string_view line, SmapsEntry& entry) {
    std::string_view key;
    std::uint64_t bytes = 0;
    if (readRow(line, &key, &bytes)) {
        if (std::uint64_t* field = sizeField(entry, key)) {
            *field += bytes;
        }
    } else if (takeUntil(line, ':') == "VmFlags") {
        for (std::string_view flag = takeWord(line); !flag.empty(); flag = takeWord(line)) {
            entry.locked |= flag == "lo";
        }
    }
}

} // namespace

bool decodeMapsLine(std::string_view line, Mapping* mapping) {
    Mapping decoded;
    if (line.empty() || line[0] == ' ' || !takeNumber(line, &decoded.start, 16) || !takeChar(line, '-') ||
        !takeNumber(line, &decoded.end, 16) || decoded.end <= decoded.start ||
        (decoded.start | decoded.end) % basePage != 0) {
        return false;
    }
    const std::string_view rights = takeWord(line);
    if (rights.size() != 4) {
        return false;
    }
    decoded.readable = rights[0] == 'r';
    decoded.writable = rights[1] == 'w';
    decoded.executable = rights[2] == 'x';
    decoded.shared = rights[3] == 's';
    if (!takeNumber(line, &decoded.fileOffset, 16) || !takeNumber(line, &decoded.deviceMajor, 16) ||
        !takeChar(line, ':') || !takeNumber(line, &decoded.deviceMinor, 16) ||
        !takeNumber(line, &decoded.inode)) {
        return false;
    }
    skipBlanks(line);
    decoded.name = unescaped(line);
    *mapping = std::move(decoded);
    return true;
}

void decodeMaps(std::string_view lines, std::vector<Mapping>* mappings) {
    Mapping mapping;
    while (!lines.empty()) {
        if (decodeMapsLine(takeLine(lines), &mapping) && mapping.name != "[vsyscall]") {
            mappings->push_back(std::move(mapping));
        }
    }
}

void decodeSmaps(std::string_view lines, std::vector<SmapsEntry>* entries) {
    Mapping mapping;
    while (!lines.empty()) {
        const std::string_view line = takeLine(lines);
        if (decodeMapsLine(line, &mapping)) {
            entries->push_back({.start = mapping.start});
        } else if (!entries->empty()) {
            decodeSmapsField(line, entries->back());
        }
    }
}

std::uint64_t decodeRollupLazyFree(std::string_view text) {
    while (!text.empty()) {
        std::string_view key;
        std::uint64_t bytes = 0;
        if (readRow(takeLine(text), &key, &bytes) && key == "LazyFree") {
            return bytes;
        }
    }
    return 0;
}

} // namespace tally::platform
