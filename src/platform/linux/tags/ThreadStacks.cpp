#include "platform/linux/tags/ThreadStacks.h"

#include "platform/linux/io/Notes.h"
#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/io/TextScan.h"
#include "platform/linux/machine/ProcessStat.h"
#include "platform/linux/tags/NamelessMemory.h"
#include "platform/linux/tags/TagTable.h"

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <string>
#include <vector>

namespace tally::platform {

namespace {

constexpr std::uint64_t largestGuard = 64 << 10;
constexpr std::size_t mostThreadsAsked = 1024; // 14 us each

constexpr const char* stacksUnnamed = "stacks of threads are not told apart";

/// The mappings that lie as stacks do.
std::vector<std::size_t> candidates(std::span<const Mapping> mappings, std::span<const std::uint32_t> tags) {
    std::vector<std::size_t> found;
    for (std::size_t i = 1; i < mappings.size(); ++i) {
        const Mapping& guard = mappings[i - 1];
        const Mapping& stack = mappings[i];
        if (tags[i] == tags::untagged && isNamelessMemory(stack) && stack.writable && !stack.executable &&
            isNamelessMemory(guard) && isInaccessible(guard) && guard.end == stack.start &&
            guard.size() <= largestGuard) {
            found.push_back(i);
        }
    }
    return found;
}

std::vector<std::uint64_t> stackPointers(const std::string& folder) {
    std::vector<std::uint64_t> pointers;
    // The folder is a thread's own where the first thread has ended.
    const std::string parent = folder.substr(0, folder.find("/task/")) + "/task";
    std::vector<std::int32_t> threads = listNumbered(parent).value_or(std::vector<std::int32_t>());
    threads.resize(std::min(threads.size(), mostThreadsAsked));
    for (const std::int32_t thread : threads) {
        const auto text = readSystemRecord(parent + "/" + std::to_string(thread) + "/syscall");
        if (!text) {
            noteRefusal("Stack pointers could not be read", errno, stacksUnnamed);
        }
        if (const auto pointer = decodeStackPointer(text.value_or(""))) {
            pointers.push_back(*pointer);
        }
    }
    std::sort(pointers.begin(), pointers.end());
    return pointers;
}

bool holdsOneOf(const Mapping& mapping, std::span<const std::uint64_t> pointers) {
    const auto first = std::lower_bound(pointers.begin(), pointers.end(), mapping.start);
    return first != pointers.end() && *first < mapping.end;
}

} // namespace

std::optional<std::uint64_t> decodeStackPointer(std::string_view text) {
    // "running", or the call's number and arguments, then the stack pointer and the instruction pointer.
    std::string_view line = takeLine(text);
    std::vector<std::string_view> words;
    for (std::string_view word = takeWord(line); !word.empty(); word = takeWord(line)) {
        words.push_back(word);
    }
    std::uint64_t pointer = 0;
    if (words.size() < 3 || !words[words.size() - 2].starts_with("0x")) {
        return std::nullopt;
    }
    words[words.size() - 2].remove_prefix(2);
    return takeNumber(words[words.size() - 2], &pointer, 16) ? std::optional(pointer) : std::nullopt;
}

void tagThreadStacks(const std::string& folder, std::span<const Mapping> mappings,
                     std::span<std::uint32_t> tags) {
    const std::vector<std::size_t> found = candidates(mappings, tags);
    if (found.empty()) {
        return;
    }
    const auto text = readSystemRecord(folder + "/stat");
    if (!text) {
        noteRefusal("The number of threads could not be read", errno, stacksUnnamed);
    }
    const std::optional<ProcessStat> stat = decodeStat(text.value_or(""));
    const std::size_t others = stat && stat->threads > 1 ? static_cast<std::size_t>(stat->threads) - 1 : 0;
    if (others == 0) {
        return; // a forked child keeps the stacks of threads that it does not have
    }
    std::vector<std::uint64_t> pointers;
    if (found.size() > others) {
        pointers = stackPointers(folder);
    }
    for (const std::size_t i : found) {
        if (found.size() <= others || holdsOneOf(mappings[i], pointers)) {
            tags[i] = tags::stack;
        }
    }
}

} // namespace tally::platform
