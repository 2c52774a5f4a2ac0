#include "platform/linux/corpse/StoppedThreads.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/processes/ProcessStat.h"

#include <dirent.h>
#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace tally::platform {

namespace {

using Clock = std::chrono::steady_clock;

// A thread that waits for a disk or a vfork does not react before that is over, and one that makes threads
// without end is never caught; the others would wait for it.
constexpr std::chrono::milliseconds patience(1000);

std::string threadFolder(std::int32_t pid, std::int32_t thread) {
    return processFolder(pid) + "/task/" + std::to_string(thread);
}

std::vector<std::int32_t> listThreads(std::int32_t pid) {
    const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir((processFolder(pid) + "/task").c_str()),
                                                     closedir);
    std::vector<std::int32_t> threads;
    while (const dirent* entry = folder ? readdir(folder.get()) : nullptr) {
        std::int32_t id = 0;
        const char* const end = entry->d_name + std::strlen(entry->d_name);
        if (std::from_chars(entry->d_name, end, id).ptr == end) {
            threads.push_back(id);
        }
    }
    return threads;
}

/// Whether the thread has ended, though it is still listed: a first thread is until the others have.
bool hasEnded(std::int32_t pid, std::int32_t thread) {
    const auto stat = decodeStat(readSystemFile(threadFolder(pid, thread) + "/stat").value_or(""));
    return !stat || stat->state == 'Z' || stat->state == 'X';
}

/// The process that traces the thread; 0 when none does.
std::int32_t tracerOf(std::int32_t pid, std::int32_t thread) {
    const std::string status = readSystemFile(threadFolder(pid, thread) + "/status").value_or("");
    constexpr std::string_view key = "\nTracerPid:";
    const std::size_t at = status.find(key);
    std::string_view rest =
        std::string_view(status).substr(at == std::string::npos ? status.size() : at + key.size());
    std::int32_t tracer = 0;
    takeNumber(rest, &tracer);
    return tracer;
}

long trace(__ptrace_request request, std::int32_t thread, int signal = 0) {
    return ptrace(request, thread, nullptr, static_cast<long>(signal));
}

} // namespace

StoppedThreads::StoppedThreads(std::int32_t pid) : pid_(pid), status_(stopAll()) {}

StoppedThreads::~StoppedThreads() {
    for (const auto& [id, thread] : threads_) {
        if (thread.state == Thread::State::stopped) {
            trace(PTRACE_DETACH, id, thread.signal);
        }
    }
}

kern_return_t StoppedThreads::stopAll() {
    if (tracerOf(getpid(), getpid()) == pid_) { // the two would wait for each other
        return KERN_NO_ACCESS;
    }
    const auto deadline = Clock::now() + patience;
    for (bool isNew = true;;) {
        const kern_return_t status = seizeNewThreads(&isNew);
        if (status != KERN_SUCCESS) {
            return status;
        }
        if (!isNew) {
            break;
        }
        for (const auto& [id, thread] : threads_) {
            if (thread.state == Thread::State::running) {
                trace(PTRACE_INTERRUPT, id);
            }
        }
        if (!awaitThreads(deadline)) {
            return KERN_OPERATION_TIMED_OUT;
        }
    }
    const bool isAnyLeft = std::any_of(threads_.begin(), threads_.end(), [](const auto& entry) {
        return entry.second.state == Thread::State::stopped;
    });
    return isAnyLeft ? KERN_SUCCESS : KERN_TERMINATED;
}

/// Threads go on while others are seized, so that none stands still for longer than it must.
kern_return_t StoppedThreads::seizeNewThreads(bool* isNew) {
    *isNew = false;
    for (const std::int32_t id : listThreads(pid_)) {
        if (threads_.contains(id)) {
            continue;
        }
        if (trace(PTRACE_SEIZE, id) == 0) {
            threads_[id] = {};
            *isNew = true;
        } else if (hasEnded(pid_, id)) {
            threads_[id] = {.state = Thread::State::gone};
        } else {
            return tracerOf(pid_, id) != 0 ? KERN_RIGHT_EXISTS : KERN_NO_ACCESS;
        }
    }
    return KERN_SUCCESS;
}

/// Waits until every thread has stopped or ended. @return false when time is up before.
bool StoppedThreads::awaitThreads(std::chrono::steady_clock::time_point deadline) {
    for (;;) {
        bool isAllStill = true;
        for (auto& [id, thread] : threads_) {
            isAllStill = look(id, thread) && isAllStill;
        }
        const bool isLate = Clock::now() > deadline;
        if (isAllStill || isLate) {
            return isAllStill && !isLate;
        }
        std::this_thread::sleep_for(std::chrono::microseconds(20));
    }
}

/// Takes note of what the thread did. @return whether it holds still.
bool StoppedThreads::look(std::int32_t id, Thread& thread) {
    if (thread.state != Thread::State::running) {
        return true;
    }
    int status = 0;
    const pid_t changed = waitpid(id, &status, __WALL | WNOHANG);
    if (changed == id && WIFSTOPPED(status)) {
        // Stopped as asked, or on the way to take a signal: then it must still get that.
        const bool isAsAsked = status >> 16 == PTRACE_EVENT_STOP;
        thread = {.state = Thread::State::stopped, .signal = isAsAsked ? 0 : WSTOPSIG(status)};
    } else if (changed == id || (changed < 0 && errno == ECHILD) || (id == pid_ && hasEnded(pid_, id))) {
        thread.state = Thread::State::gone; // the end of the first thread is not told while there are others
    }
    return thread.state != Thread::State::running;
}

} // namespace tally::platform
