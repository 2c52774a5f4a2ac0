// The per-region accounting switch "vm.self_region_tally", a value of this process: 0 at start.

#pragma once

#include "platform/View.h"

namespace tally::platform {

View currentView();

} // namespace tally::platform
