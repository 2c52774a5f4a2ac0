#include "platform/linux/io/Gather.h"

#include <atomic>

namespace tally::platform {

namespace {

std::atomic<Gather*> underWay = nullptr;

} // namespace

Gather::Gather() { underWay = this; }
Gather::~Gather() { underWay = nullptr; }

Gather* Gather::current() { return underWay; }

} // namespace tally::platform
