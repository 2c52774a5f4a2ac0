// Queues on threads. The parallel loop of a concurrent queue has one worker per processor, which take items
// in index order; a serial queue has one thread for all of its life.

#include "platform/dispatch.h"

#include <algorithm>
#include <atomic>
#include <system_error>
#include <utility>
#include <vector>

namespace tally::platform {

void dispatch_apply(std::size_t count, const ConcurrentQueue& /*queue*/,
                    const std::function<void(std::size_t)>& item) {
    std::atomic<std::size_t> next = 0;
    const auto work = [&]() noexcept { // one that is left half done, others could wait for
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

SerialQueue::SerialQueue(std::string queueLabel, std::uint32_t quality)
    : label(std::move(queueLabel)), qualityOfService(quality), thread_([this] { run(); }) {}

SerialQueue::~SerialQueue() {
    {
        const std::lock_guard lock(mutex_);
        isEnding_ = true;
    }
    changed_.notify_one();
    thread_.join();
}

void SerialQueue::async(std::function<void()> item) {
    {
        const std::lock_guard lock(mutex_);
        items_.push_back(std::move(item));
    }
    changed_.notify_one();
}

void SerialQueue::sync(const std::function<void()>& item) {
    Semaphore done;
    async([&] {
        item();
        done.signal();
    });
    done.wait();
}

void SerialQueue::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        changed_.wait(lock, [this] { return isEnding_ || !items_.empty(); });
        if (items_.empty()) {
            return;
        }
        std::function<void()> item = std::move(items_.front());
        items_.pop_front();
        lock.unlock();
        item();
        item = nullptr;
        lock.lock();
    }
}

void Semaphore::signal() {
    const std::lock_guard lock(mutex_);
    ++count_;
    raised_.notify_one(); // under the lock: who waits may destroy the semaphore as soon as it is free
}

void Semaphore::wait() {
    std::unique_lock lock(mutex_);
    raised_.wait(lock, [this] { return count_ != 0; });
    --count_;
}

} // namespace tally::platform
