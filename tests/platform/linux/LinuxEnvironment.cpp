// The subject is a child process that maps a few kinds of memory, tells where, and waits.

#include "platform/Environment.h"

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <stdexcept>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace tally::platform {

namespace {

constexpr std::size_t page = 4096;

void require(bool done, const char* what) {
    if (!done) {
        throw std::runtime_error(what);
    }
}

/// A file that is there while the object lives.
class TemporaryFile {
  public:
    explicit TemporaryFile(std::size_t size) : descriptor_(mkstemp(path_)) {
        const std::string contents(size, 'x');
        require(descriptor_ >= 0 && write(descriptor_, contents.data(), size) == static_cast<ssize_t>(size),
                "a temporary file");
        fsync(descriptor_); // its pages in the cache are clean from here on
    }
    ~TemporaryFile() {
        close(descriptor_);
        unlink(path_);
    }
    TemporaryFile(const TemporaryFile&) = delete;
    TemporaryFile& operator=(const TemporaryFile&) = delete;
    int descriptor() const { return descriptor_; }
    const char* path() const { return path_; }

  private:
    char path_[32] = "/var/tmp/contract_XXXXXX";
    int descriptor_;
};

/// Maps `pages` pages between two guards, so that no neighbour merges with them, and writes to the first
/// `written`.
void* mapAndWrite(std::size_t pages, std::size_t written, int protection, int flags, int descriptor) {
    void* guards = mmap(nullptr, (pages + 2) * page, PROT_NONE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    void* memory =
        mmap(static_cast<char*>(guards) + page, pages * page, protection, flags | MAP_FIXED, descriptor, 0);
    madvise(memory, pages * page, MADV_NOHUGEPAGE);
    for (std::size_t i = 0; i < written; ++i) {
        static_cast<volatile char*>(memory)[i * page] = 1;
    }
    return memory;
}

class LinuxEnvironment final : public Environment {
  public:
    LinuxEnvironment() {
        int told[2];
        require(pipe(told) == 0 && pipe(stop_) == 0, "pipes");
        pid_ = fork();
        require(pid_ >= 0, "a child");
        if (pid_ == 0) {
            beSubject(told[1]);
        }
        close(told[1]);
        close(stop_[0]);
        void* starts[4];
        require(read(told[0], static_cast<void*>(starts), sizeof starts) == sizeof starts,
                "the child's word");
        close(told[0]);
        const auto known = [&](int which, std::size_t pages, std::size_t written, const char* path) {
            known_.push_back(
                {reinterpret_cast<std::uint64_t>(starts[which]), pages * page, written, written, path});
        };
        known(0, 64, 20, "");
        known(1, 32, 8, "");
        known(2, 256, 0, "");
        known(3, 16, 5, file_.path());
    }
    ~LinuxEnvironment() override { endSubject(); }

    std::int32_t subject() const override { return pid_; }
    std::vector<KnownMapping> knownMappings() const override { return known_; }
    void leaveSubjectAsZombie() override {
        if (stop_[1] >= 0) {
            close(stop_[1]);
            stop_[1] = -1;
            siginfo_t ended;
            waitid(P_PID, static_cast<id_t>(pid_), &ended, WEXITED | WNOWAIT);
        }
    }
    void endSubject() override {
        leaveSubjectAsZombie();
        waitpid(pid_, nullptr, 0);
    }
    void interrupt() override { kill(getpid(), SIGINT); }
    void terminate() override { kill(getpid(), SIGTERM); }

  private:
    [[noreturn]] void beSubject(int tell) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        close(stop_[1]);
        const int both = PROT_READ | PROT_WRITE;
        void* const starts[4] = {
            mapAndWrite(64, 20, both, MAP_PRIVATE | MAP_ANONYMOUS, -1),
            mapAndWrite(32, 8, both, MAP_SHARED | MAP_ANONYMOUS, -1),
            mapAndWrite(256, 0, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1),
            mapAndWrite(16, 5, both, MAP_PRIVATE, file_.descriptor()),
        };
        char nothing;
        const bool isTold = write(tell, static_cast<const void*>(starts), sizeof starts) == sizeof starts;
        _exit(isTold && read(stop_[0], &nothing, 1) == 0 ? 0 : 1);
    }

    TemporaryFile file_{16 * page};
    int stop_[2] = {-1, -1};
    pid_t pid_ = -1;
    std::vector<KnownMapping> known_;
};

} // namespace

std::unique_ptr<Environment> Environment::make() { return std::make_unique<LinuxEnvironment>(); }

} // namespace tally::platform
