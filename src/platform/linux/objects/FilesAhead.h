// FilesAhead: what is asked of a process's files while it still runs, for when it holds still.
//
// A file system can keep us waiting, and the process would stand still as long. So nothing but the kernel's
// memory is asked then: files are known from before, or not at all.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/objects/Backing.h"

#include <cstddef>
#include <cstdint>
#include <map>
#include <span>
#include <string>
#include <tuple>

namespace tally::platform {

class FilesAhead {
  public:
    /// Asks the files behind the mappings of the process folder `folder`; those whose page cache a walk would
    /// ask are opened. @param objectView whether that is to be one as the VM objects see it.
    void ask(const std::string& folder, std::span<const Mapping> mappings, bool objectView);

    /// What the mapping shows; null when it was not asked for.
    const BackingObject* objectOf(const Mapping& mapping) const;
    /// The file behind the mapping; not open when it was not opened.
    Descriptor fileOf(const Mapping& mapping) const;

    /// What this thread has to go by; null when it may ask.
    static const FilesAhead* ofThisThread();

    /// While one of these is there, its thread asks no file.
    class Use {
      public:
        explicit Use(const FilesAhead& ahead);
        ~Use();
        Use(const Use&) = delete;
        Use& operator=(const Use&) = delete;
    };

  private:
    struct Known {
        BackingObject object;
        Descriptor file;
    };
    using Key = std::tuple<std::uint64_t, std::uint64_t, std::string>; // device, inode, name

    static Key keyOf(const Mapping& mapping);

    std::map<Key, Known> known_;
};

} // namespace tally::platform
