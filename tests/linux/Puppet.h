// Puppet: a child that holds memory as a test asked for, and the ledger it told.

#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace tally::test {

/// A program started with pipes on its input and output; ended by pid when the holder goes away.
class Puppet {
  public:
    /// What one mapping of the puppet must show.
    struct Entry {
        std::string name;
        std::uint64_t address = 0;
        std::uint64_t size = 0;                     // bytes
        std::map<std::string, std::string> figures; // "dirty" and so on: bytes, or "any"
    };

    /// Starts a puppet program with `arguments` and waits until it is ready; throws when it ends before.
    explicit Puppet(std::vector<std::string> arguments, const std::string& program = PUPPET_PROGRAM);
    ~Puppet();
    Puppet(const Puppet&) = delete;
    Puppet& operator=(const Puppet&) = delete;

    int pid() const { return pid_; }
    const std::vector<Entry>& ledger() const { return ledger_; }
    /// Sends SIGKILL and, unless it is to stay a zombie, waits for the end.
    void end(bool leaveZombie = false);

  private:
    int pid_ = -1;
    int input_ = -1;
    std::vector<Entry> ledger_;
};

/// What a program wrote and how it ended.
struct Outcome {
    int status = -1; // exit status, or 128 + the signal
    std::string output;
    std::string errors;
};

/// Runs a program to its end.
Outcome run(const std::vector<std::string>& command);

/// A folder of the test's own, removed with what is in it.
class TemporaryFolder {
  public:
    TemporaryFolder();
    ~TemporaryFolder();
    const std::string& path() const { return path_; }

  private:
    std::string path_;
};

/// Whether this is root of the machine: neither of a user namespace only, nor bereft of its rights.
bool isRoot();

/// Whether the kernel is older than `major`.`minor`.
bool isKernelBefore(int major, int minor);

/// Waits until no other test changes this setting of the machine. @return a descriptor; until it is closed no
/// other can.
int lockOfMachine(const std::string& setting);

/// Raises the machine's pool of huge pages, alone among tests, and puts it back. `granted` is how many pages
/// there were to be had.
class HugePagePool {
  public:
    explicit HugePagePool(int pages);
    ~HugePagePool();
    int granted() const { return granted_; }

  private:
    int lock_ = -1;
    int before_ = 0;
    int granted_ = 0;
};

} // namespace tally::test
