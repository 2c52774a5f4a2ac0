// Interrupts as a source: the signal wakes a thread that calls the handler.
//
// What happened is counted, and the event only wakes: one that could not be posted delays, and loses nothing.

#include "platform/dispatch.h"
#include "platform/linux/io/Descriptor.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <system_error>
#include <thread>
#include <utility>

namespace tally::platform {

namespace {

// What the signal handler tells, and where: one source exists at a time.
std::atomic<int> signalEvent = -1;
std::atomic<std::uint64_t> signalsSeen = 0;

constexpr int longestSleep = 100; // milliseconds

void wake(int event) {
    const std::uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = write(event, &one, sizeof(one));
}

void onSignal(int /*signal*/) {
    const int error = errno;
    ++signalsSeen;
    wake(signalEvent);
    errno = error;
}

class InterruptSource final : public SignalSource {
  public:
    InterruptSource(Descriptor event, std::function<void()> handler)
        : event_(std::move(event)), handler_(std::move(handler)), thread_([this] { run(); }) {}
    ~InterruptSource() override { InterruptSource::cancel(); }

    void cancel() override {
        if (thread_.joinable()) {
            isCancelled_ = true;
            wake(event_.number());
            thread_.join();
            signalEvent = -1;
        }
    }

  private:
    void run() {
        for (bool isOver = false; !isOver;) {
            pollfd event{event_.number(), POLLIN, 0};
            std::uint64_t posted = 0;
            if (poll(&event, 1, longestSleep) > 0 && read(event_.number(), &posted, sizeof(posted)) < 0) {
                std::this_thread::sleep_for(std::chrono::milliseconds(longestSleep));
            }
            isOver = isCancelled_; // what came before is handled yet
            for (std::uint64_t left = signalsSeen.exchange(0); left != 0; --left) {
                handler_();
            }
        }
    }

    Descriptor event_;
    std::function<void()> handler_;
    std::atomic<bool> isCancelled_ = false;
    std::thread thread_; // the last: it uses the others
};

bool isIgnored(int signal) {
    struct sigaction action {};
    return sigaction(signal, nullptr, &action) == 0 && action.sa_handler == SIG_IGN;
}

void catchSignal(int signal) {
    struct sigaction action {};
    action.sa_handler = onSignal;
    action.sa_flags = SA_RESTART;
    sigaction(signal, &action, nullptr);
}

} // namespace

std::unique_ptr<SignalSource> dispatch_source_interrupt(InterruptSignals which,
                                                        std::function<void()> handler) {
    Descriptor event(eventfd(0, EFD_CLOEXEC));
    if (!event.isOpen()) {
        return nullptr;
    }
    signalEvent = event.number();
    signalsSeen = 0;
    std::unique_ptr<SignalSource> source;
    try {
        source = std::make_unique<InterruptSource>(std::move(event), std::move(handler));
    } catch (const std::system_error&) { // no thread is to be had
        signalEvent = -1;
        return nullptr;
    }
    catchSignal(SIGINT); // also where a shell had it ignored, as for what runs in the background
    if (which == InterruptSignals::sigintAndTermination) {
        for (const int signal : {SIGTERM, SIGHUP}) {
            if (!isIgnored(signal)) {
                catchSignal(signal);
            }
        }
    }
    return source;
}

void restoreDefaultInterruptAction() {
    for (const int signal : {SIGINT, SIGTERM, SIGHUP}) {
        struct sigaction action {};
        if (sigaction(signal, nullptr, &action) == 0 && action.sa_handler == onSignal) {
            std::signal(signal, SIG_DFL);
        }
    }
}

} // namespace tally::platform
