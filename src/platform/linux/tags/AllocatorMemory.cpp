#include "platform/linux/tags/AllocatorMemory.h"

#include "platform/linux/tags/NamelessMemory.h"
#include "platform/linux/tags/PresentMemory.h"
#include "platform/linux/tags/TagTable.h"

#include <algorithm>
#include <array>
#include <cstddef>

namespace tally::platform {

namespace {

constexpr std::uint64_t heapSize = 64 << 20; // of an arena, which heaps are aligned to as well
constexpr std::uint64_t smallestMappedChunk = 128 << 10;
constexpr std::uint64_t chunkIsMapped = 2; // flag in a chunk's size
constexpr int mostChunks = 64;             // that are followed: after so many in a row there is no doubt
constexpr int mostCandidates = 8192;       // about 12 ms

/// The first words of a heap, as the C library lays them out.
struct HeapHeader {
    std::uint64_t arena;
    std::uint64_t previous; // heap of the same arena, 0 for its first
    std::uint64_t size;
    std::uint64_t usable; // bytes from the start that are not inaccessible
};

/// An arena lies in its first heap, behind the header, which has grown by 16 bytes (2.35).
bool isFirstHeap(const HeapHeader& header, std::uint64_t start) {
    return header.previous == 0 && (header.arena == start + 0x30 || header.arena == start + 0x20);
}

class AllocatorRules {
  public:
    AllocatorRules(const std::string& folder, std::span<const Mapping> mappings)
        : mappings_(mappings), memory_(folder) {}

    /// @param isPresent whether every page of the mapping is known to be present; so below.
    bool isArena(const Mapping& mapping, bool isPresent) {
        // Heaps that are used to their end have no inaccessible rest, and the kernel merges neighbours.
        for (std::uint64_t heap = mapping.start; heap % heapSize == 0 && heap < mapping.end;
             heap += heapSize) {
            std::array<std::uint64_t, 4> words{};
            if (!memory_.read(heap, words, isPresent)) {
                return false;
            }
            const HeapHeader header{words[0], words[1], words[2], words[3]};
            const bool isHeap = header.size != 0 && header.size <= header.usable &&
                                header.usable <= heapSize &&
                                (isFirstHeap(header, heap) || continuesArena(header));
            if (!isHeap || heap + header.usable == mapping.end) {
                return isHeap;
            }
        }
        return false;
    }

    /// Whether mapped chunks cover all of the mapping, or all but a smaller rest of what it merged with.
    bool isMappedChunks(const Mapping& mapping, bool isPresent) {
        std::uint64_t chunk = mapping.start;
        for (int count = 0; chunk < mapping.end; ++count) {
            if (count == mostChunks) {
                return true;
            }
            std::array<std::uint64_t, 2> words{};
            if (!memory_.read(chunk, words, isPresent) || words[0] != 0) {
                break;
            }
            const std::uint64_t size = words[1] - chunkIsMapped;
            if (size == 0 || size % basePage != 0 || size > mapping.end - chunk) {
                break;
            }
            chunk += size;
        }
        return chunk - mapping.start > mapping.end - chunk;
    }

  private:
    /// Whether the heap before the one of `header` is mapped memory where a heap can be.
    bool continuesArena(const HeapHeader& header) const {
        const auto at = std::upper_bound(
            mappings_.begin(), mappings_.end(), header.previous,
            [](std::uint64_t address, const Mapping& mapping) { return address < mapping.end; });
        return header.previous != 0 && header.previous % heapSize == 0 && at != mappings_.end() &&
               at->start <= header.previous && isNamelessMemory(*at) && at->writable;
    }

    std::span<const Mapping> mappings_;
    PresentMemory memory_;
};

} // namespace

void tagAllocatorMemory(const std::string& folder, std::span<const Mapping> mappings,
                        const PageStates& states, std::span<std::uint32_t> tags) {
    AllocatorRules rules(folder, mappings);
    int candidates = 0;
    for (std::size_t i = 0; i < mappings.size() && candidates < mostCandidates; ++i) {
        const Mapping& mapping = mappings[i];
        if (tags[i] != tags::untagged || !isNamelessMemory(mapping) || !mapping.writable ||
            states.mappings[i].anonymous == 0) {
            continue;
        }
        const bool canBeArena = mapping.start % heapSize == 0;
        const bool canBeChunks = mapping.size() >= smallestMappedChunk;
        candidates += canBeArena || canBeChunks ? 1 : 0;
        const bool isPresent = states.mappings[i].anonymous == mapping.pages();
        if (canBeArena && rules.isArena(mapping, isPresent)) {
            tags[i] = tags::mallocArena;
        } else if (canBeChunks && rules.isMappedChunks(mapping, isPresent)) {
            tags[i] = tags::mallocLarge;
        }
    }
}

} // namespace tally::platform
