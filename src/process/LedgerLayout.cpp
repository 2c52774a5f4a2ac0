#include "process/LedgerLayout.h"

#include "platform/bsd_process.h"

#include <algorithm>
#include <cstdio>
#include <span>
#include <string_view>
#include <vector>

namespace tally {

using namespace platform;

namespace {

/// Every entry that the kernel defines; absent when it does not tell.
std::optional<std::vector<ledger_template_info>> ledgerEntryTemplates() {
    std::vector<ledger_template_info> entries(80);
    for (;;) {
        const int count = ledger_template(entries);
        if (count < 0) {
            return std::nullopt;
        }
        if (static_cast<std::size_t>(count) < entries.size()) {
            entries.resize(static_cast<std::size_t>(count));
            return entries;
        }
        entries.resize(2 * entries.size()); // there may be more
    }
}

std::string_view nameOf(const ledger_template_info& entry) {
    const std::span<const char> field(entry.lti_name);
    return {field.begin(), std::ranges::find(field, '\0')};
}

} // namespace

LedgerLayout readLedgerLayout() {
    LedgerLayout layout;
    const auto entries = ledgerEntryTemplates();
    if (!entries) {
        std::perror("Unable to retrieve ledger template info");
        return layout;
    }
    layout.entryCount = entries->size();
    int matches = 0;
    for (std::size_t i = 0; i < entries->size() && matches < 3; ++i) {
        const std::string_view name = nameOf((*entries)[i]);
        auto* const index = name == "page_table"   ? &layout.pageTable
                            : name == "phys_tally" ? &layout.physTally
                                                   : nullptr;
        if (index != nullptr) {
            *index = i;
            ++matches;
        }
    }
    return layout;
}

const LedgerLayout& ledgerLayout() {
    static const LedgerLayout layout = readLedgerLayout();
    return layout;
}

} // namespace tally
