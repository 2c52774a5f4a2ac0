#include "linux/Puppet.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/file.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/utsname.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <utility>

namespace tally::test {

namespace {

struct Pipe {
    int reading = -1;
    int writing = -1;
    Pipe() {
        std::array<int, 2> ends{};
        if (pipe2(ends.data(), O_CLOEXEC) == 0) {
            reading = ends[0];
            writing = ends[1];
        }
    }
};

/// Starts `command` with the given descriptors as 0, 1 and 2 (-1: as they are).
int start(const std::vector<std::string>& command, int input, int output, int errors) {
    std::vector<char*> arguments;
    for (const std::string& word : command) {
        arguments.push_back(const_cast<char*>(word.c_str()));
    }
    arguments.push_back(nullptr);
    const int pid = fork();
    if (pid == 0) {
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (input < 0) { // the tool: a huge page more of its own is no leak
            prctl(PR_SET_THP_DISABLE, 1, 0, 0, 0);
        }
        signal(SIGINT, SIG_DFL); // what runs in the background of a shell has it ignored
        signal(SIGPIPE, SIG_DFL);
        const std::array<int, 3> wanted{input, output, errors};
        for (int i = 0; i < 3; ++i) {
            if (wanted[i] >= 0) {
                dup2(wanted[i], i);
            }
        }
        execv(arguments[0], arguments.data());
        _exit(127);
    }
    return pid;
}

std::string readAll(int descriptor) {
    std::string text;
    std::array<char, 4096> buffer;
    for (ssize_t count; (count = read(descriptor, buffer.data(), buffer.size())) > 0;) {
        text.append(buffer.data(), static_cast<std::size_t>(count));
    }
    close(descriptor);
    return text;
}

/// Waits for the end. @return the exit status, or 128 + the signal.
int waitFor(int pid) {
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

constexpr const char* poolFile = "/proc/sys/vm/nr_hugepages";

int readPool() {
    int pages = 0;
    std::ifstream(poolFile) >> pages;
    return pages;
}

} // namespace

Puppet::Puppet(std::vector<std::string> arguments, const std::string& program) {
    arguments.insert(arguments.begin(), program);
    const Pipe in;
    const Pipe out;
    pid_ = start(arguments, in.reading, out.writing, -1);
    close(in.reading);
    close(out.writing);
    input_ = in.writing;
    std::FILE* stream = fdopen(out.reading, "r");
    std::array<char, 1024> line;
    bool ready = false;
    while (!ready && std::fgets(line.data(), line.size(), stream) != nullptr) {
        std::istringstream words(line.data());
        Entry entry;
        words >> entry.name >> std::hex >> entry.address >> std::dec >> entry.size;
        ready = entry.name == "ready";
        for (std::string figure; words >> figure;) {
            const std::size_t equals = figure.find('=');
            entry.figures[figure.substr(0, equals)] = figure.substr(equals + 1);
        }
        if (!ready) {
            ledger_.push_back(std::move(entry));
        }
    }
    std::fclose(stream);
    if (!ready) {
        end();
        close(input_);
        throw std::runtime_error("the puppet ended before it was ready");
    }
}

void Puppet::end(bool leaveZombie) {
    if (pid_ > 0) {
        kill(pid_, SIGKILL);
        siginfo_t ended{};
        waitid(P_PID, static_cast<id_t>(pid_), &ended, WEXITED | (leaveZombie ? WNOWAIT : 0));
        if (!leaveZombie) {
            pid_ = -1;
        }
    }
}

Puppet::~Puppet() {
    end();
    close(input_);
}

Outcome run(const std::vector<std::string>& command) {
    const Pipe out;
    const Pipe err;
    const int pid = start(command, -1, out.writing, err.writing);
    close(out.writing);
    close(err.writing);
    Outcome outcome;
    std::thread reader([&] { outcome.errors = readAll(err.reading); });
    outcome.output = readAll(out.reading);
    reader.join();
    outcome.status = waitFor(pid);
    return outcome;
}

TemporaryFolder::TemporaryFolder() {
    std::string path = std::filesystem::temp_directory_path() / "tally-test-XXXXXX";
    if (mkdtemp(path.data()) == nullptr) {
        throw std::runtime_error("no temporary folder");
    }
    path_ = path;
}

TemporaryFolder::~TemporaryFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

bool isKernelBefore(int major, int minor) {
    utsname system{};
    int itsMajor = 0;
    int itsMinor = 0;
    return uname(&system) == 0 && std::sscanf(system.release, "%d.%d", &itsMajor, &itsMinor) == 2 &&
           std::pair(itsMajor, itsMinor) < std::pair(major, minor);
}

bool isRoot() {
    constexpr ino_t firstUserNamespace = 0xEFFFFFFD; // of every kernel
    struct stat space {};
    __user_cap_header_struct header{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct rights[_LINUX_CAPABILITY_U32S_3]{};
    return geteuid() == 0 && stat("/proc/self/ns/user", &space) == 0 && space.st_ino == firstUserNamespace &&
           syscall(SYS_capget, &header, rights) == 0 && (rights[0].effective & 1U << CAP_SYS_ADMIN) != 0;
}

int lockOfMachine(const std::string& setting) {
    const std::string path = "/tmp/tally-test-" + setting + ".lock";
    const int lock = open(path.c_str(), O_CREAT | O_RDWR | O_CLOEXEC, 0600);
    flock(lock, LOCK_EX);
    return lock;
}

HugePagePool::HugePagePool(int pages) {
    lock_ = lockOfMachine("hugepages");
    before_ = readPool();
    std::ofstream(poolFile) << before_ + pages;
    granted_ = readPool() - before_;
}

HugePagePool::~HugePagePool() {
    std::ofstream(poolFile) << before_;
    close(lock_);
}

} // namespace tally::test
