#include "platform/gather.h"

#include "platform/linux/families/Families.h"
#include "platform/linux/gather/MachineState.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/objects/Backing.h"

namespace tally::platform {

GatherScope::GatherScope() {
    forgetFileSystems();
    beginLayouts();
    beginMachineState();
    beginFamilies();
}

GatherScope::~GatherScope() {
    endFamilies();
    endMachineState();
}

} // namespace tally::platform
