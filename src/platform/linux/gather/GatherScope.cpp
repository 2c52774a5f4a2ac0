#include "platform/gather.h"

#include "platform/linux/families/Families.h"
#include "platform/linux/gather/LazyFree.h"
#include "platform/linux/gather/MachineState.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/io/FileInquiry.h"
#include "platform/linux/objects/FileSystems.h"
#include "platform/linux/owned/OwnedGather.h"
#include "platform/linux/pieces/MarkedPages.h"

namespace tally::platform {

GatherScope::GatherScope() {
    forgetFileSystems();
    beginLayouts();
    beginOwned();
    beginMachineState();
    beginFamilies();
    beginMarks();
    restartLazyFreeSearch(true);
}

GatherScope::~GatherScope() {
    restartLazyFreeSearch(false);
    endMarks();
    endFamilies();
    endOwned();
    endMachineState();
    endInquiries();
}

} // namespace tally::platform
