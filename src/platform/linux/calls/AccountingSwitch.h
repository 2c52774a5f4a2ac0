// The per-region accounting switch "vm.self_region_tally", a value of this process: 0 at start.

#pragma once

namespace tally::platform {

/// On: mappings count as charged to the task. Off: as the VM objects see them.
bool accountingSwitchIsOn();

} // namespace tally::platform
