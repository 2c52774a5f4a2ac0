// The subject is the puppet that has memory of every kind. What of it is known is what the puppet says.

#include "linux/Puppet.h"
#include "platform/Environment.h"

#include <csignal>
#include <cstdlib>
#include <fstream>
#include <sstream>
#include <unistd.h>

namespace tally::platform {

namespace {

class LinuxEnvironment final : public Environment {
  public:
    std::int32_t subject() const override { return pid_; }
    std::vector<KnownMapping> knownMappings() const override {
        std::vector<KnownMapping> known;
        for (const test::Puppet::Entry& entry : subject_.ledger()) {
            const auto pages = [&](const char* key) {
                const auto figure = entry.figures.find(key);
                return figure == entry.figures.end() ? 0 : std::stoull(figure->second) / 4096;
            };
            const bool isOfFile = entry.name.starts_with("file-");
            if (entry.name == "anonymous" || entry.name == "zero-pages" || entry.name == "shared-anonymous" ||
                (isOfFile && entry.figures.contains("clean"))) {
                known.push_back({entry.address, entry.size, pages("dirty") + pages("clean"), pages("dirty"),
                                 isOfFile ? fileAt(entry.address) : ""});
            }
        }
        return known;
    }
    void leaveSubjectAsZombie() override { subject_.end(true); }
    void endSubject() override { subject_.end(); }
    void interrupt() override { kill(getpid(), SIGINT); }
    void terminate() override { kill(getpid(), SIGTERM); }

  private:
    /// The name of the file in the line of the mapping that begins at `address`.
    std::string fileAt(std::uint64_t address) const {
        std::ifstream maps("/proc/" + std::to_string(pid_) + "/maps");
        for (std::string line; std::getline(maps, line);) {
            if (std::stoull(line, nullptr, 16) == address) {
                return line.substr(line.find('/'));
            }
        }
        return "no such mapping";
    }

    test::Puppet subject_{{"zoo"}};
    const std::int32_t pid_ = subject_.pid();
};

} // namespace

std::unique_ptr<Environment> Environment::make() { return std::make_unique<LinuxEnvironment>(); }

} // namespace tally::platform
