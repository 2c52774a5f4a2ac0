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
    const auto stat = decodeStat(readSystemRecord(threadFolder(pid, thread) + "/stat").value_or(""));
    return !stat || stat->state == 'Z' || stat->state == 'X';
}

/// The process that traces the thread; 0 when none does.
std::int32_t tracerOf(std::int32_t pid, std::int32_t thread) {
    const std::string status = readSystemRecord(threadFolder(pid, thread) + "/status").value_or("");
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

void SeizedThreads::add(std::int32_t id) {
    const std::scoped_lock lock(mutex_);
    ids_.insert(id);
}

void SeizedThreads::takeNoteOfEnds() {
    const std::scoped_lock lock(mutex_);
    std::erase_if(ids_, [](std::int32_t thread) {
        const auto id = static_cast<id_t>(thread);
        siginfo_t found{};
        // Stops of a traced thread are told whether one asks for them or not, and they are another's to take.
        if (waitid(P_PID, id, &found, WEXITED | WNOHANG | WNOWAIT | __WALL) != 0) {
            return true;
        }
        const bool hasEnded =
            found.si_pid == thread && found.si_code != CLD_TRAPPED && found.si_code != CLD_STOPPED;
        return hasEnded && waitid(P_PID, id, &found, WEXITED | WNOHANG | __WALL) == 0;
    });
}

StoppedThreads::StoppedThreads(std::int32_t pid, SeizedThreads& seized)
    : pid_(pid), seized_(seized), status_(stopAll()) {}

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
        if (isStillKnown(id)) {
            continue;
        }
        // One that has just ended can have cut the list off: it is read again.
        *isNew = true;
        if (const kern_return_t status = seize(id); status != KERN_SUCCESS) {
            return status;
        }
    }
    return KERN_SUCCESS;
}

/// Not when another thread has taken the number over: one that loads another program becomes the first.
bool StoppedThreads::isStillKnown(std::int32_t id) const {
    const auto found = threads_.find(id);
    if (found == threads_.end()) {
        return false;
    }
    return found->second.state == Thread::State::gone ? hasEnded(pid_, id)
                                                      : id != pid_ || tracerOf(pid_, id) == gettid();
}

kern_return_t StoppedThreads::seize(std::int32_t id) {
    for (int attempt = 0; attempt < 3; ++attempt) { // its number can go over to another thread meanwhile
        const bool isSeized = trace(PTRACE_SEIZE, id) == 0;
        const std::int32_t tracer = isSeized ? gettid() : tracerOf(pid_, id);
        if (tracer == gettid()) { // also one that was seized under another number
            threads_[id] = {};
            seized_.add(id);
            return KERN_SUCCESS;
        }
        if (hasEnded(pid_, id)) {
            threads_[id] = {.state = Thread::State::gone};
            return KERN_SUCCESS;
        }
        if (tracer != 0) {
            return KERN_RIGHT_EXISTS;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return KERN_NO_ACCESS;
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
