#include "platform/linux/corpse/StopSignals.h"

#include <unistd.h>

#include <atomic>
#include <cstddef>

namespace tally::platform {

namespace {

std::atomic<int> waitingSignal = 0;

void keep(int signal) { waitingSignal = signal; }

} // namespace

// A handler and no mask: whichever thread of the tool takes the signal, it would stop all of them.
StopSignals::StopSignals() {
    struct sigaction action {};
    action.sa_handler = keep;
    action.sa_flags = SA_RESTART;
    for (std::size_t i = 0; i < signals.size(); ++i) {
        if (sigaction(signals[i], nullptr, &before_[i]) == 0 && before_[i].sa_handler != SIG_IGN) {
            sigaction(signals[i], &action, nullptr);
        }
    }
}

StopSignals::~StopSignals() {
    for (std::size_t i = 0; i < signals.size(); ++i) {
        sigaction(signals[i], &before_[i], nullptr);
    }
    if (const int signal = waitingSignal.exchange(0); signal != 0) {
        kill(getpid(), signal);
    }
}

} // namespace tally::platform
