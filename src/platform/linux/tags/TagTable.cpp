#include "platform/linux/tags/TagTable.h"

#include "platform/quarry.h"

#include <algorithm>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

namespace tally::platform {

namespace {

struct Description {
    std::uint32_t tag;
    const char* text;
};
constexpr Description ownTags[] = {
    {tags::sharedAnonymous, "shared memory (anonymous)"},
    {tags::sharedMemfd, "shared memory (memfd)"},
    {tags::sharedSysV, "shared memory (SysV)"},
    {tags::hugePagePool, "huge page pool"},
    {tags::kernelPages, "kernel pages for user code"},
    {tags::goHeap, "Go heap"},
    {tags::jemalloc, "jemalloc"},
    {tags::generatedCode, "generated code"},
    {tags::otherNamed, "other named memory"},
};

// Names that libraries and runtimes are known to give; the first that fits decides.
struct KnownName {
    std::string_view beginning;
    std::uint32_t tag;
};
constexpr KnownName knownNames[] = {
    {"glibc: pthread stack", tags::stack},
    {"glibc: pthread user stack", tags::stack},
    {"glibc: malloc arena", tags::mallocArena},
    {"glibc: malloc", tags::mallocLarge},
    {"glibc: loader malloc", tags::loaderMalloc},
    {"stack_and_tls", tags::stack},
    {"libc_malloc", tags::mallocArena},
    {"scudo:primary", tags::mallocArena},
    {"scudo:secondary", tags::mallocLarge},
    {"dalvik-jit-code", tags::generatedCode},
    {"dalvik-", tags::java},
    {"js-executable-memory", tags::scriptCode},
    {"Go: heap", tags::goHeap},
};

/// The names that got a slot of their own, in the order of the slots.
class NamedSlots {
  public:
    std::uint32_t tagOf(std::string_view name) {
        const std::scoped_lock lock(mutex_);
        const auto found = tags_.find(name);
        if (found != tags_.end()) {
            return found->second;
        }
        const auto tag = static_cast<std::uint32_t>(tags::firstNamed + names_.size());
        if (tag > tags::lastNamed) {
            return tags::otherNamed;
        }
        names_.emplace_back(name);
        return tags_.emplace(name, tag).first->second;
    }

    std::optional<std::string> nameOf(std::uint32_t tag) {
        const std::scoped_lock lock(mutex_);
        return tag >= tags::firstNamed && tag - tags::firstNamed < names_.size()
                   ? std::optional(names_[tag - tags::firstNamed])
                   : std::nullopt;
    }

  private:
    std::mutex mutex_;
    std::vector<std::string> names_;
    std::map<std::string, std::uint32_t, std::less<>> tags_;
};

NamedSlots& namedSlots() {
    static NamedSlots slots;
    return slots;
}

} // namespace

std::uint32_t tagOfName(std::string_view name) {
    name.remove_prefix(std::min(name.find_first_not_of(' '), name.size()));
    for (const KnownName& known : knownNames) {
        if (name.starts_with(known.beginning)) {
            return known.tag;
        }
    }
    return name.empty() ? tags::untagged : namedSlots().tagOf(name);
}

std::uint32_t QRYTagForRegionTypeDescription(std::string_view description) {
    for (const Description& own : ownTags) {
        if (own.text == description) {
            return own.tag;
        }
    }
    return description.empty() ? tags::untagged : namedSlots().tagOf(description);
}

std::optional<std::string> QRYRegionTypeDescriptionForTag(std::uint32_t tag) {
    for (const Description& own : ownTags) {
        if (own.tag == tag) {
            return own.text;
        }
    }
    const std::optional<std::string> name = namedSlots().nameOf(tag);
    return name ? name : "Memory Tag " + std::to_string(tag);
}

} // namespace tally::platform
