// The parallel loop of a concurrent queue: one worker per processor, items handed out in index order.

#include "platform/dispatch.h"

#include <algorithm>
#include <atomic>
#include <system_error>
#include <thread>
#include <vector>

namespace tally::platform {

void dispatch_apply(std::size_t count, const ConcurrentQueue& /*queue*/,
                    const std::function<void(std::size_t)>& item) {
    std::atomic<std::size_t> next = 0;
    const auto work = [&] {
        for (std::size_t index = next++; index < count; index = next++) {
            item(index);
        }
    };
    const std::size_t processors = std::max(1U, std::thread::hardware_concurrency());
    std::vector<std::jthread> workers; // beside the calling thread, joined at the end
    try {
        while (workers.size() + 1 < std::min(processors, count)) {
            workers.emplace_back(work);
        }
    } catch (const std::system_error&) {
        // No more threads to be had: those that there are do all of the work.
    }
    work();
}

} // namespace tally::platform
