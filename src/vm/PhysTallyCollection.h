// The kernel's per-region accounting switch, as the tool sees it.
//
// On: mappings are counted as charged to their task. Off: as their VM objects see them. The state is cached
// for the run and asked by every layer above. Written by the driver before any gather; concurrent first reads
// store the same value.

#pragma once

namespace tally {

/// Whether the kernel switch "vm.self_region_tally" is on. False, without a message, on a kernel that has
/// none.
bool physTallyCollectionEnabled();

/// Writes the switch and forgets the cached state. A failure is a message on standard error.
void setPhysTallyCollectionEnabled(int value);

} // namespace tally
