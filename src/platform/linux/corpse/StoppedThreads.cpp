#include "platform/linux/corpse/StoppedThreads.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/machine/ProcessStat.h"

#include <sys/ptrace.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace tally::platform {

namespace {

// A thread that waits for a disk or a vfork does not react before that is over, and one that makes threads
// without end is never caught; the others would wait for it.
constexpr std::chrono::milliseconds mostPatience(1000);
constexpr std::chrono::microseconds usualRound(250);
constexpr std::chrono::seconds longestWait(10);

std::string threadFolder(std::int32_t pid, std::int32_t thread) {
    return processFolder(pid) + "/task/" + std::to_string(thread);
}

std::vector<std::int32_t> listThreads(std::int32_t pid) {
    return listNumbered(processFolder(pid) + "/task").value_or(std::vector<std::int32_t>());
}

/// The state of the thread, as a letter; that of one that has ended when it is not listed.
char stateOf(std::int32_t pid, std::int32_t thread) {
    const auto stat = decodeStat(readSystemRecord(threadFolder(pid, thread) + "/stat").value_or(""));
    return stat ? stat->state : 'X';
}

/// Whether the thread has ended, though it is still listed: a first thread is until the others have.
bool hasEnded(std::int32_t pid, std::int32_t thread) {
    const char state = stateOf(pid, thread);
    return state == 'Z' || state == 'X';
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

bool Patience::isOver() {
    const auto now = Clock::now();
    spent_ += std::min<Clock::duration>(now - std::exchange(last_, now), usualRound);
    return spent_ > mostPatience || now - begin_ > longestWait;
}

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
    Patience patience;
    for (bool isNew = true;;) {
        const kern_return_t status = seizeNewThreads(&isNew, patience);
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
        if (!awaitThreads(patience)) {
            return KERN_OPERATION_TIMED_OUT;
        }
    }
    const bool isAnyLeft = std::any_of(threads_.begin(), threads_.end(), [](const auto& entry) {
        return entry.second.state == Thread::State::stopped;
    });
    return isAnyLeft ? KERN_SUCCESS : KERN_TERMINATED;
}

/// Threads go on while others are seized, so that none stands still for longer than it must.
kern_return_t StoppedThreads::seizeNewThreads(bool* isNew, Patience& patience) {
    *isNew = false;
    for (const std::int32_t id : listThreads(pid_)) {
        if (isStillKnown(id)) {
            continue;
        }
        // One that has just ended can have cut the list off: it is read again.
        *isNew = true;
        if (const kern_return_t status = seize(id, patience); status != KERN_SUCCESS) {
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
    if (found->second.state == Thread::State::gone) {
        return hasEnded(pid_, id);
    }
    return id != pid_ || (tracerOf(pid_, id) == gettid() && stateOf(pid_, id) == 't');
}

kern_return_t StoppedThreads::seize(std::int32_t id, Patience& patience) {
    // Its number can go over to another thread meanwhile, again and again in a process that loads programs
    // all the time. A refusal is one when it stays.
    for (int refusals = 0; refusals < 50;) {
        const bool isSeized = trace(PTRACE_SEIZE, id) == 0;
        const bool isRefused = !isSeized && errno != ESRCH;
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
        refusals += isRefused ? 1 : 0;
        if (patience.isOver()) {
            return isRefused ? KERN_NO_ACCESS : KERN_OPERATION_TIMED_OUT;
        }
        std::this_thread::sleep_for(std::chrono::microseconds(200));
    }
    return KERN_NO_ACCESS;
}

/// Waits until every thread has stopped or ended. @return false when time is up before.
bool StoppedThreads::awaitThreads(Patience& patience) {
    for (;;) {
        bool isAllStill = true;
        for (auto& [id, thread] : threads_) {
            isAllStill = look(id, thread) && isAllStill;
        }
        const bool isLate = patience.isOver();
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
