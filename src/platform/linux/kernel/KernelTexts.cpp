#include "platform/linux/kernel/KernelTexts.h"

#include "platform/linux/io/TextScan.h"

#include <array>
#include <optional>

namespace tally::platform {

namespace {

/// Takes the number that follows `key` at the start of `line`, after blanks.
std::optional<std::uint64_t> numberAfter(std::string_view line, std::string_view key) {
    skipBlanks(line);
    std::uint64_t number = 0;
    if (!line.starts_with(key)) {
        return std::nullopt;
    }
    line.remove_prefix(key.size());
    return takeNumber(line, &number) ? std::optional(number) : std::nullopt;
}

/// "name+0x94/0x3e0" as "name"; a module's name stays behind it.
std::string symbolOf(std::string_view caller, std::string_view rest) {
    std::string symbol(caller.substr(0, caller.find('+')));
    skipBlanks(rest);
    if (rest.starts_with('[')) {
        symbol += ' ';
        symbol += takeWord(rest);
    }
    return symbol;
}

} // namespace

Meminfo::Meminfo(std::string_view text) {
    while (!text.empty()) {
        std::string_view key;
        std::uint64_t number = 0;
        if (readRow(takeLine(text), &key, &number)) {
            rows_.emplace(key, number);
        }
    }
}

std::uint64_t Meminfo::operator[](std::string_view key) const {
    const auto row = rows_.find(key);
    return row == rows_.end() ? 0 : row->second;
}

std::vector<SlabCache> decodeSlabinfo(std::string_view text, std::uint64_t pageSize) {
    std::vector<SlabCache> caches;
    while (!text.empty()) {
        // name, elements in use and in all, size of one, elements and pages per slab : ... : slabdata, slabs
        // in use and in all
        std::string_view line = takeLine(text);
        std::string_view use = takeUntil(line, ':');
        takeUntil(line, ':');
        SlabCache cache{.name = std::string(takeWord(use))};
        std::array<std::uint64_t, 5> numbers{};
        bool isWhole = !cache.name.empty();
        for (std::uint64_t& number : numbers) {
            isWhole = isWhole && takeNumber(use, &number);
        }
        std::uint64_t slabs = 0;
        if (!isWhole || takeWord(line) != "slabdata" || !takeNumber(line, &slabs) ||
            !takeNumber(line, &slabs)) {
            continue;
        }
        cache.elementsInUse = numbers[0];
        cache.elementSize = numbers[2];
        cache.size = numbers[4] * slabs * pageSize;
        caches.push_back(std::move(cache));
    }
    return caches;
}

VmallocRows decodeVmallocinfo(std::string_view text, std::uint64_t pageSize) {
    constexpr std::string_view pagesKey = " pages=";
    VmallocRows rows;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        takeWord(line); // addresses
        takeWord(line); // size, with a guard page
        const std::size_t pagesAt = line.find(pagesKey);
        std::uint64_t pages = 0;
        if (pagesAt == std::string_view::npos) {
            continue;
        }
        std::string_view count = line.substr(pagesAt + pagesKey.size());
        const std::string_view caller = takeWord(line);
        if (takeNumber(count, &pages) && !caller.empty()) {
            const bool isTold = !caller.starts_with("pages=");
            rows[isTold ? symbolOf(caller, line) : "unknown caller"] += pages * pageSize;
        }
    }
    return rows;
}

ZoneSums decodeZoneinfo(std::string_view text, std::uint64_t pageSize) {
    ZoneSums sums;
    while (!text.empty()) {
        const std::string_view line = takeLine(text);
        sums.onProcessorLists += numberAfter(line, "count:").value_or(0) * pageSize;
        sums.present += numberAfter(line, "present ").value_or(0) * pageSize;
        sums.compressed += numberAfter(line, "nr_zspages ").value_or(0) * pageSize;
    }
    return sums;
}

std::vector<LoadedModule> decodeModules(std::string_view text) {
    std::vector<LoadedModule> modules;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        LoadedModule module{.name = std::string(takeWord(line))};
        if (!module.name.empty() && takeNumber(line, &module.size)) {
            modules.push_back(std::move(module));
        }
    }
    return modules;
}

std::map<std::string, std::uint64_t> decodeKernelImage(std::string_view iomem) {
    std::map<std::string, std::uint64_t> parts;
    while (!iomem.empty()) {
        std::string_view line = takeLine(iomem);
        std::uint64_t first = 0;
        std::uint64_t last = 0;
        if (!takeNumber(line, &first, 16) || !takeChar(line, '-') || !takeNumber(line, &last, 16)) {
            continue;
        }
        constexpr std::string_view image = " : Kernel ";
        if (line.starts_with(image) && last >= first) {
            parts[std::string(line.substr(image.size()))] += last == 0 ? 0 : last - first + 1;
        }
    }
    return parts;
}

} // namespace tally::platform
