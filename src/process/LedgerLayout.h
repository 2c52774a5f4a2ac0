// LedgerLayout: which entries a task's ledger has, and which of them the tool reads.

#pragma once

#include <cstddef>
#include <optional>

namespace tally {

struct LedgerLayout {
    std::optional<std::size_t> entryCount; // absent: the kernel does not tell
    std::optional<std::size_t> pageTable;  // index of "page_table"
    std::optional<std::size_t> physTally;  // index of "phys_tally"
};

/// Asks the kernel. A failure is a message on standard error.
LedgerLayout readLedgerLayout();

/// The layout, asked for once in the run. Thread-safe.
const LedgerLayout& ledgerLayout();

} // namespace tally
