// Notes: what reading a process met that its report must say, such as a file that could not be looked at.
//
// Whoever reads for a process takes the notes of its thread; the calls below need not know of which.

#pragma once

#include <cerrno>
#include <string>
#include <vector>

namespace tally::platform {

/// While one of these is there, notes of this thread go to `notes`, each text once. They may be nested.
class NoteTaker {
  public:
    explicit NoteTaker(std::vector<std::string>& notes);
    ~NoteTaker();
    NoteTaker(const NoteTaker&) = delete;
    NoteTaker& operator=(const NoteTaker&) = delete;

  private:
    std::vector<std::string>* outer_;
};

/// Leaves a note, if anybody takes it.
void note(std::string text);

/// Whether a call that failed with `error` was refused or broken; else there was nothing to be had, or no
/// longer.
inline bool isRefusal(int error) { return error != 0 && error != ENOENT && error != ESRCH; }

/// Notes "<what> (<the error's text>): <consequence>", if the error is a refusal.
void noteRefusal(const char* what, int error, const char* consequence);

} // namespace tally::platform
