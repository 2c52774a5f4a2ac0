// An argument vector of a test, and what is written while it is used.

#pragma once

#include <gtest/gtest.h>

#include <sstream>
#include <string>
#include <utility>
#include <vector>

namespace tally {

class CommandLine {
  public:
    /// `text` without the program's name, its words parted by one blank.
    explicit CommandLine(const std::string& text) {
        std::istringstream words("tally " + text);
        for (std::string word; std::getline(words, word, ' ');) {
            words_.push_back(word);
        }
        for (std::string& word : words_) {
            pointers_.push_back(word.data());
        }
        pointers_.push_back(nullptr);
    }

    int argc() const { return static_cast<int>(words_.size()); }
    char** argv() { return pointers_.data(); }

  private:
    std::vector<std::string> words_;
    std::vector<char*> pointers_;
};

/// What `action` wrote to standard output and standard error.
template <typename Action>
std::pair<std::string, std::string> written(Action&& action) {
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    action();
    std::string output = testing::internal::GetCapturedStdout();
    return {std::move(output), testing::internal::GetCapturedStderr()};
}

} // namespace tally
