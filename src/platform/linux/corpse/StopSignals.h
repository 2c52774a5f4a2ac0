// StopSignals: the signals by which a terminal stops the tool, put off for as long as it holds others'
// threads.
//
// A tool that is stopped then would leave them stopped, for as long as its user likes. One at a time.

#pragma once

#include <csignal>

#include <array>

namespace tally::platform {

class StopSignals {
  public:
    /// From now on they wait.
    StopSignals();
    /// Takes them as they would have been, if any came.
    ~StopSignals();
    StopSignals(const StopSignals&) = delete;
    StopSignals& operator=(const StopSignals&) = delete;

  private:
    static constexpr std::array<int, 3> signals{SIGTSTP, SIGTTIN, SIGTTOU};

    std::array<struct sigaction, signals.size()> before_{};
};

} // namespace tally::platform
