// Standard output, written through its descriptor: the kernel says what is lost, and why.
//
// A pipe or a terminal is asked first whether it is ready, so that the text can be given up while nobody
// reads.

#include "platform/output_file.h"

#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <limits>
#include <new>

namespace tally::platform {

namespace {

constexpr int patienceMilliseconds = 1000; // without a reader

bool isRegularFile(int descriptor) {
    struct stat status {};
    return fstat(descriptor, &status) == 0 && S_ISREG(status.st_mode);
}

} // namespace

StandardOutput::StandardOutput()
    : mostAtOnce_(isRegularFile(STDOUT_FILENO) ? std::numeric_limits<std::size_t>::max() : PIPE_BUF),
      stream_(fopencookie(this, "w", {.read = nullptr, .write = write, .seek = nullptr, .close = nullptr})) {
    if (stream_ == nullptr) {
        throw std::bad_alloc();
    }
}

StandardOutput::~StandardOutput() { std::fclose(stream_); }

int StandardOutput::error() const { return error_ == EPIPE || error_ == ECANCELED ? 0 : error_; }

bool StandardOutput::awaitReader() const {
    pollfd output{.fd = STDOUT_FILENO, .events = POLLOUT, .revents = 0};
    for (;;) {
        const int ready = poll(&output, 1, patienceMilliseconds);
        if (ready > 0 || (ready < 0 && errno != EINTR)) {
            return true;
        }
        if (ready == 0 && !waits_) {
            return false;
        }
    }
}

ssize_t StandardOutput::write(void* self, const char* bytes, std::size_t size) {
    auto& output = *static_cast<StandardOutput*>(self);
    for (std::size_t at = 0; at < size && output.error_ == 0;) {
        if (!output.awaitReader()) {
            output.error_ = ECANCELED;
            break;
        }
        const ssize_t count = ::write(STDOUT_FILENO, bytes + at, std::min(size - at, output.mostAtOnce_));
        if (count >= 0) {
            at += static_cast<std::size_t>(count);
        } else if (errno != EINTR && errno != EAGAIN) {
            output.error_ = errno;
        }
    }
    return static_cast<ssize_t>(size); // also of what is lost: the documents go on
}

} // namespace tally::platform
