// ValueFormat: byte counts in the three formats, paths and names.

#include "output/ValueFormat.h"

#include "base/Format.h"

#include <bsd/stdlib.h>

namespace tally {

std::uint64_t pageCount(std::uint64_t bytes, std::uint64_t pageSize) {
    return pageSize == 0 ? 0 : (bytes + pageSize - 1) / pageSize;
}

std::string ValueFormat::formatValue(std::int64_t bytes) const {
    switch (summaryFormat) {
    case TLSummaryFormat::bytes:
        return formatted("%lld B", static_cast<long long>(bytes));
    case TLSummaryFormat::pages:
        return formatted("%llu pages", static_cast<unsigned long long>(
                                           pageCount(static_cast<std::uint64_t>(bytes), pageSize)));
    case TLSummaryFormat::formatted:
        break;
    }
    char text[8] = "";
    humanize_number(text, sizeof(text), bytes, "B", HN_AUTOSCALE, 0);
    return text;
}

std::string ValueFormat::shortenPath(std::string_view path) const {
    const std::size_t lastOfComponent = path.find_last_not_of('/');
    if (shows(TLTextOptionWide) || lastOfComponent == path.npos) {
        return std::string(path);
    }
    std::string_view component = path.substr(0, lastOfComponent + 1);
    component.remove_prefix(component.rfind('/') + 1);
    return component.size() == path.size() ? std::string(path) : ".../" + std::string(component);
}

std::string ValueFormat::displayName(std::string_view name, Name detailedName) const {
    std::string text(name);
    if (!detailedName.isNull()) {
        text += " " + shortenPath(detailedName.view());
    }
    return printable(text);
}

} // namespace tally
