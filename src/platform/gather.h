// The frame of one gather: what is read once for all of its tasks, and what the platform has to say about
// one.

#pragma once

#include "platform/kern_return.h"

#include <memory>
#include <string>
#include <vector>

namespace tally::platform {

/// Everything that the platform reads once per gather is read again after one of these was made, and is
/// dropped with it. One at a time; tasks may also be walked without one.
class GatherScope {
  public:
    GatherScope();
    ~GatherScope();
    GatherScope(const GatherScope&) = delete;
    GatherScope& operator=(const GatherScope&) = delete;

  private:
    std::shared_ptr<void> gather_; // the platform's own
};

/// Texts for a process's warnings, such as a figure that rights did not allow and an estimate stands in for.
struct task_notices {
    std::vector<std::string> of_task;
    std::vector<std::string> of_machine; // on this machine other processes have the same, for the same reason
};
/// Takes what the platform noted about the figures of `task` since the last call.
task_notices task_take_notices(mach_port_t task);

/// Whether `task` shares memory by descent with another process to which there is a right, so that what it is
/// charged may stay the same while the pages behind it change. True where that cannot be told.
bool task_has_relatives(mach_port_t task);

} // namespace tally::platform
