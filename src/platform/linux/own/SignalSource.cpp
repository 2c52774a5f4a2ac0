// Interrupts as a source: the signal wakes a thread that calls the handler.

#include "platform/dispatch.h"
#include "platform/linux/io/Descriptor.h"

#include <sys/eventfd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstdint>
#include <system_error>
#include <thread>
#include <utility>

namespace tally::platform {

namespace {

// Where the signal handler writes: one source exists at a time.
std::atomic<int> signalEvent = -1;

constexpr std::uint64_t signalled = 1;
constexpr std::uint64_t cancelled = std::uint64_t{1} << 32;

void post(int event, std::uint64_t what) {
    [[maybe_unused]] const ssize_t written = write(event, &what, sizeof(what));
}

void onSignal(int /*signal*/) {
    const int error = errno;
    post(signalEvent, signalled);
    errno = error;
}

class InterruptSource final : public SignalSource {
  public:
    InterruptSource(Descriptor event, std::function<void()> handler)
        : event_(std::move(event)), handler_(std::move(handler)), thread_([this] { run(); }) {}
    ~InterruptSource() override { InterruptSource::cancel(); }

    void cancel() override {
        if (thread_.joinable()) {
            signalEvent = -1;
            post(event_.number(), cancelled);
            thread_.join();
        }
    }

  private:
    void run() {
        for (;;) {
            std::uint64_t events = 0;
            const ssize_t count = read(event_.number(), &events, sizeof(events));
            if (count != sizeof(events)) {
                continue; // a signal that this thread got to handle itself
            }
            for (std::uint64_t i = 0; i < events % cancelled; ++i) {
                handler_();
            }
            if (events >= cancelled) {
                return;
            }
        }
    }

    Descriptor event_;
    std::function<void()> handler_;
    std::thread thread_;
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
