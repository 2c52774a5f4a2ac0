#include "platform/linux/objects/FileInquiry.h"

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/machine/ProcessStat.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/statfs.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <map>
#include <memory>
#include <mutex>
#include <set>

namespace tally::platform {

namespace {

constexpr std::size_t longestPath = 8192; // a path of the kernel's below a folder of /proc
constexpr int patience = 1000;            // milliseconds
constexpr int longestWait = 10;           // of them, for who is kept from running by the machine's load

// --- the process that asks. It is a copy of one with other threads, so it makes nothing but system calls.

void answer(const char* path, FileAnswer& reply) {
    struct statfs system {};
    reply.error = 0;
    reply.headLength = 0;
    const bool isKnown = statx(AT_FDCWD, path, AT_STATX_DONT_SYNC, STATX_BASIC_STATS, &reply.status) == 0 ||
                         (errno != ENOENT && errno != ESRCH && statusByOlderCall(path, reply.status));
    if (!isKnown || statfs(path, &system) != 0) {
        reply.error = errno;
        return;
    }
    reply.fileSystemType = static_cast<std::uint64_t>(system.f_type);
    if (S_ISREG(reply.status.stx_mode)) { // opening anything else can act on a device
        const int file = open(path, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
        const ssize_t length = file < 0 ? -1 : pread(file, reply.head.data(), reply.head.size(), 0);
        reply.error = length < 0 ? errno : 0;
        reply.headLength = static_cast<std::uint32_t>(length < 0 ? 0 : length);
        if (file >= 0) {
            close(file);
        }
    }
}

[[noreturn]] void serve(int socket) {
    setsid(); // what a terminal sends is for the tool
    // Nobody shall wait for the end of the tool's output because of this process.
    dup2(socket, 0);
    if (syscall(SYS_close_range, 1U, ~0U, 0U) != 0) {
        for (int other = 1; other < 65536; ++other) {
            close(other);
        }
    }
    char path[longestPath + 1];
    FileAnswer reply;
    for (;;) {
        const ssize_t length = recv(0, path, longestPath, 0);
        if (length == 0 || (length < 0 && errno != EINTR)) {
            _exit(0);
        }
        if (length > 0) {
            path[length] = '\0';
            answer(path, reply);
            send(0, &reply, sizeof(reply), MSG_NOSIGNAL);
        }
    }
}

// --- the tool's side of it

/// The processes that ask and that were not seen to end: one that is late may never end.
struct Children {
    std::mutex mutex;
    std::set<pid_t> pids;
};

Children& children() {
    static Children all;
    return all;
}

class Asker {
  public:
    Asker() = default;
    Asker(const Asker&) = delete;
    Asker& operator=(const Asker&) = delete;
    ~Asker() { end(); }

    std::optional<FileAnswer> ask(const std::string& path) {
        const std::scoped_lock lock(mutex_);
        FileAnswer reply;
        if (isLate_ || path.size() > longestPath || (child_ <= 0 && !begin())) {
            errno = isLate_ ? ETIMEDOUT : EAGAIN;
            return std::nullopt;
        }
        if (send(socket_.number(), path.data(), path.size(), MSG_NOSIGNAL) < 0 || !awaitReply() ||
            recv(socket_.number(), &reply, sizeof(reply), 0) != static_cast<ssize_t>(sizeof(reply))) {
            isLate_ = true;
            kill(child_, SIGKILL);
            end();
            errno = ETIMEDOUT;
            return std::nullopt;
        }
        errno = reply.error;
        return reply.error == 0 ? std::optional(reply) : std::nullopt;
    }

    void end() {
        socket_ = Descriptor(); // which ends it
        if (child_ > 0) {
            if (waitpid(child_, nullptr, isLate_ ? WNOHANG : 0) == child_) {
                const std::scoped_lock lock(children().mutex);
                children().pids.erase(child_);
            }
            child_ = 0;
        }
    }

    void endBetweenQuestions() {
        const std::scoped_lock lock(mutex_);
        end();
    }

  private:
    bool begin() {
        int ends[2];
        if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0) {
            return false;
        }
        socket_ = Descriptor(ends[0]);
        const Descriptor other(ends[1]);
        const std::scoped_lock lock(children().mutex);
        child_ = fork();
        if (child_ == 0) {
            serve(other.number());
        }
        if (child_ > 0) {
            children().pids.insert(child_);
        }
        return child_ > 0;
    }

    bool awaitReply() const {
        for (int waited = 0; waited < longestWait; ++waited) {
            pollfd event{socket_.number(), POLLIN, 0};
            int ready = 0;
            while ((ready = poll(&event, 1, patience)) < 0 && errno == EINTR) {
            }
            if (ready != 0) {
                return ready > 0;
            }
            const std::optional<ProcessStat> stat = readProcessStat(child_);
            if (!stat || stat->state != 'R') {
                return false;
            }
        }
        return false;
    }

    std::mutex mutex_;
    Descriptor socket_;
    pid_t child_ = 0;
    bool isLate_ = false;
};

struct Askers {
    std::mutex mutex;
    std::map<std::uint64_t, std::unique_ptr<Asker>> byDevice; // none is taken out: who was late is remembered
};

Askers& askers() {
    children(); // which must outlive them
    static Askers all;
    return all;
}

} // namespace

bool statusByOlderCall(const char* path, struct statx& status) {
    struct stat older {};
    if (stat(path, &older) != 0) {
        return false;
    }
    status.stx_mode = static_cast<std::uint16_t>(older.st_mode);
    status.stx_nlink = static_cast<std::uint32_t>(older.st_nlink);
    status.stx_dev_major = major(older.st_dev);
    status.stx_dev_minor = minor(older.st_dev);
    status.stx_ino = older.st_ino;
    status.stx_size = static_cast<std::uint64_t>(older.st_size);
    status.stx_blocks = static_cast<std::uint64_t>(older.st_blocks);
    return true;
}

std::optional<FileAnswer> inquire(std::uint64_t device, const std::string& path) {
    Asker* asker = nullptr;
    {
        const std::scoped_lock lock(askers().mutex);
        std::unique_ptr<Asker>& entry = askers().byDevice[device];
        if (!entry) {
            entry = std::make_unique<Asker>();
        }
        asker = entry.get();
    }
    return asker->ask(path);
}

bool isInquirer(std::int32_t pid) {
    const std::scoped_lock lock(children().mutex);
    return children().pids.contains(pid);
}

void endInquiries() {
    const std::scoped_lock lock(askers().mutex);
    for (const auto& [device, asker] : askers().byDevice) {
        asker->endBetweenQuestions();
    }
}

} // namespace tally::platform
