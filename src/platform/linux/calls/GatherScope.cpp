#include "platform/gather.h"

#include "platform/linux/calls/Task.h"
#include "platform/linux/images/LayoutTable.h"
#include "platform/linux/io/Gather.h"
#include "platform/linux/io/MachineNotices.h"
#include "platform/linux/objects/FileInquiry.h"
#include "platform/linux/objects/FileSystems.h"

namespace tally::platform {

GatherScope::GatherScope() : gather_(std::make_shared<Gather>()) {
    forgetFileSystems();
    beginLayouts();
}

GatherScope::~GatherScope() { endInquiries(); }

bool task_has_relatives(mach_port_t task) {
    const std::shared_ptr<Task> found = taskOfPort(task);
    return !found || found->hasRelatives();
}

task_notices task_take_notices(mach_port_t task) {
    task_notices notices;
    if (const std::shared_ptr<Task> found = taskOfPort(task)) {
        for (std::string& text : found->takeNotices()) {
            (isOfMachine(text) ? notices.of_machine : notices.of_task).push_back(std::move(text));
        }
    }
    return notices;
}

} // namespace tally::platform
