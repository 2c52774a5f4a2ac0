// Environment: what the contract suite needs of a platform that its calls cannot give: a process to ask
// about.

#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tally::platform {

/// Memory that the subject is known to map.
struct KnownMapping {
    std::uint64_t start = 0;
    std::uint64_t size = 0;     // bytes
    std::uint64_t resident = 0; // pages
    std::uint64_t dirtied = 0;  // pages
    std::string file;           // behind it; empty: none
};

class Environment {
  public:
    /// The environment of the platform that this program is linked with.
    static std::unique_ptr<Environment> make();
    virtual ~Environment() = default;

    /// A process that holds still; gone or a zombie after the calls below.
    virtual std::int32_t subject() const = 0;
    virtual std::vector<KnownMapping> knownMappings() const = 0;
    /// Ends the subject; its parent does not look.
    virtual void leaveSubjectAsZombie() = 0;
    /// Ends the subject without a trace.
    virtual void endSubject() = 0;
    /// Sends SIGINT to this program.
    virtual void interrupt() = 0;
    /// Sends SIGTERM to this program.
    virtual void terminate() = 0;
};

} // namespace tally::platform
