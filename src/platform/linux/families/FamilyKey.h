// FamilyKey: what processes that descend from one exec by forking have in common.
//
// The addresses at which the kernel laid the program out are drawn anew at every exec and inherited by every
// fork. Where they are not drawn, because randomisation is off, the 16 random bytes that every exec gets tell
// programs apart.

#pragma once

#include "platform/linux/machine/ProcessStat.h"

#include <array>
#include <compare>
#include <cstdint>

namespace tally::platform {

struct FamilyKey {
    std::array<std::uint64_t, 6> layout{}; // as in ProcessStat

    /// Whether the kernel told the addresses at all: it does not where tracing is not permitted.
    bool isKnown() const { return layout[0] > 1; }
    friend auto operator<=>(const FamilyKey&, const FamilyKey&) = default;
};

/// The key of the process that `stat` is of: of another thread where the first has ended.
FamilyKey familyKeyOf(const ProcessStat& stat);

/// The random bytes that process `pid` got at its exec; zeros when they cannot be read.
std::array<std::uint64_t, 2> readExecRandom(std::int32_t pid);

/// Whether the kernel lays process `pid` out without drawing addresses.
bool isLayoutFixed(std::int32_t pid);

/// Compares the address spaces of two processes: 0 the same, negative or positive in an order that stays; 3
/// when they cannot be compared.
int compareAddressSpaces(std::int32_t a, std::int32_t b);
inline constexpr int incomparableAddressSpaces = 3;

} // namespace tally::platform
