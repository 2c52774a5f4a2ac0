// Work queues and signal sources.

#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace tally::platform {

// Quality-of-service classes of a queue.
inline constexpr std::uint32_t QOS_CLASS_UTILITY = 0x11;
inline constexpr std::uint32_t QOS_CLASS_USER_INITIATED = 0x19;

/// A queue that runs its items on all processors.
struct ConcurrentQueue {
    std::string label;
    std::uint32_t qualityOfService = QOS_CLASS_UTILITY;
};

/// Runs `item(0)` to `item(count - 1)`, started in index order, as many at a time as there are processors,
/// and returns when all have finished. An item must not throw.
void dispatch_apply(std::size_t count, const ConcurrentQueue& queue,
                    const std::function<void(std::size_t)>& item);

/// A started source that calls its handler on a thread of its own for every signal; while one exists the
/// signal does not end the program.
class SignalSource {
  public:
    virtual ~SignalSource() = default;
    /// Stops calling the handler; returns once a running call has finished. The destructor does the same. The
    /// signal's action is not changed.
    virtual void cancel() = 0;
};

/// Starts a source for SIGINT. @return null when the system refuses one.
std::unique_ptr<SignalSource> dispatch_source_sigint(std::function<void()> handler);

/// Lets SIGINT end the program again.
void restoreDefaultSigintAction();

} // namespace tally::platform
