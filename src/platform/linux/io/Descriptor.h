// Descriptor: one open file descriptor, closed when its holder goes away.

#pragma once

#include <unistd.h>

#include <utility>

namespace tally::platform {

class Descriptor {
  public:
    Descriptor() = default;
    explicit Descriptor(int number) : number_(number) {}
    Descriptor(Descriptor&& other) noexcept : number_(std::exchange(other.number_, -1)) {}
    Descriptor& operator=(Descriptor&& other) noexcept {
        std::swap(number_, other.number_);
        return *this;
    }
    Descriptor(const Descriptor&) = delete;
    Descriptor& operator=(const Descriptor&) = delete;
    ~Descriptor() {
        if (number_ >= 0) {
            close(number_);
        }
    }

    bool isOpen() const { return number_ >= 0; }
    int number() const { return number_; }
    /// Hands the descriptor over: it is the caller's to close.
    int release() { return std::exchange(number_, -1); }

  private:
    int number_ = -1;
};

} // namespace tally::platform
