#include "platform/linux/io/Notes.h"

#include "base/Format.h"

#include <algorithm>
#include <system_error>
#include <utility>

namespace tally::platform {

namespace {

thread_local std::vector<std::string>* taken = nullptr;

} // namespace

NoteTaker::NoteTaker(std::vector<std::string>& notes) : outer_(std::exchange(taken, &notes)) {}
NoteTaker::~NoteTaker() { taken = outer_; }

void note(std::string text) {
    if (taken != nullptr && std::ranges::find(*taken, text) == taken->end()) {
        taken->push_back(std::move(text));
    }
}

void noteRefusal(const char* what, int error, const char* consequence) {
    if (isRefusal(error)) {
        note(formatted("%s (%s): %s", what, std::generic_category().message(error).c_str(), consequence));
    }
}

} // namespace tally::platform
