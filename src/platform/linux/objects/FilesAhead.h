// FilesAhead: what is asked of a process's files while it still runs, for when it holds still.
//
// A file system can keep us waiting, and the process would stand still as long. So nothing but the kernel's
// memory is asked then: files are known from before, or not at all.

#pragma once

#include "platform/linux/io/Descriptor.h"
#include "platform/linux/objects/BackingObject.h"
#include "platform/linux/pages/Mapping.h"

#include <cstdint>
#include <map>
#include <string>
#include <tuple>

namespace tally::platform {

class FilesAhead {
  public:
    struct Known {
        BackingObject object; // anonymous at first, as no file is
        Descriptor file;      // where its page cache will be asked
    };

    /// What is known of the file behind the mapping, to be filled in.
    Known& enter(const Mapping& mapping) { return known_[keyOf(mapping)]; }

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
    using Key = std::tuple<std::uint64_t, std::uint64_t, std::string>; // device, inode, name

    static Key keyOf(const Mapping& mapping);

    std::map<Key, Known> known_;
};

} // namespace tally::platform
