// Names of VM tags and of ledger tags. Thread-safe.

#pragma once

#include "base/Name.h"

#include <cstdint>

namespace tally {

/// The display name of a VM user tag; never absent.
Name nameForTag(std::uint32_t tag);

/// The display name of a ledger tag; absent for the tags that have none.
Name nameForLedgerTag(std::uint64_t ledgerTag);

} // namespace tally
