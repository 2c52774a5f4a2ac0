#include "platform/linux/pages/ListMappings.h"

#include "platform/linux/io/SystemFiles.h"
#include "platform/linux/pages/DecodeMaps.h"

#include <sys/ioctl.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>

namespace tally::platform {

namespace {

// As the kernel lays it out (include/uapi/linux/fs.h of 6.11); the installed headers are older.
struct procmap_query {
    std::uint64_t size;
    std::uint64_t query_flags;
    std::uint64_t query_addr;
    std::uint64_t vma_start;
    std::uint64_t vma_end;
    std::uint64_t vma_flags;
    std::uint64_t vma_page_size;
    std::uint64_t vma_offset;
    std::uint64_t inode;
    std::uint32_t dev_major;
    std::uint32_t dev_minor;
    std::uint32_t vma_name_size;
    std::uint32_t build_id_size;
    std::uint64_t vma_name_addr;
    std::uint64_t build_id_addr;
};
static_assert(sizeof(procmap_query) == 104);

constexpr unsigned long PROCMAP_QUERY = _IOWR('f', 17, procmap_query);
constexpr std::uint64_t queryReadable = 1;
constexpr std::uint64_t queryWritable = 2;
constexpr std::uint64_t queryExecutable = 4;
constexpr std::uint64_t queryShared = 8;
constexpr std::uint64_t queryCoveringOrNext = 0x10;

// A query costs more than a line of text once names are rare: in address spaces of this many mappings, which
// are mostly anonymous, the text is read instead.
constexpr std::size_t mostQueries = 2'000;

enum class QueryResult { listed, unavailable, tooMany, failed };

/// Whether an error of a request means that there is no use in asking again.
bool saysUnknown(int error) {
    return error == ENOTTY || error == ENOSYS || error == EPERM || error == EACCES;
}

Mapping mappingFromAnswer(const procmap_query& answer, const char* name) {
    Mapping mapping;
    mapping.start = answer.vma_start;
    mapping.end = answer.vma_end;
    mapping.fileOffset = answer.vma_offset;
    mapping.inode = answer.inode;
    mapping.deviceMajor = answer.dev_major;
    mapping.deviceMinor = answer.dev_minor;
    mapping.readable = (answer.vma_flags & queryReadable) != 0;
    mapping.writable = (answer.vma_flags & queryWritable) != 0;
    mapping.executable = (answer.vma_flags & queryExecutable) != 0;
    mapping.shared = (answer.vma_flags & queryShared) != 0;
    mapping.pageSize = answer.vma_page_size;
    if (answer.vma_name_size > 1) {
        mapping.name.assign(name, answer.vma_name_size - 1); // the size counts the NUL
    }
    return mapping;
}

QueryResult queryMappings(const Descriptor& maps, std::vector<Mapping>* mappings) {
    std::array<char, 4096> name;
    std::uint64_t address = 0;
    while (mappings->size() < mostQueries) {
        procmap_query query{};
        query.size = sizeof(query);
        query.query_flags = queryCoveringOrNext;
        query.query_addr = address;
        query.vma_name_size = name.size();
        query.vma_name_addr = reinterpret_cast<std::uintptr_t>(name.data());
        if (ioctl(maps.number(), PROCMAP_QUERY, &query) != 0) {
            if (errno == EINTR) {
                continue;
            }
            if (errno == ENOENT) {
                return QueryResult::listed;
            }
            // Older kernels and filters refuse it, and a path of more than a page, as bind mounts can make,
            // only the text gives in full.
            return errno == ESRCH ? QueryResult::failed : QueryResult::unavailable;
        }
        mappings->push_back(mappingFromAnswer(query, name.data()));
        address = query.vma_end;
    }
    return QueryResult::tooMany;
}

bool listAll(const Descriptor& maps, std::vector<Mapping>* mappings) {
    static std::atomic<bool> queriesAnswered = true; // false once this kernel has refused one
    mappings->clear();
    if (queriesAnswered) {
        const QueryResult result = queryMappings(maps, mappings);
        if (result == QueryResult::listed || result == QueryResult::failed) {
            return result == QueryResult::listed;
        }
        if (result == QueryResult::unavailable && saysUnknown(errno)) {
            queriesAnswered = false;
        }
    }
    mappings->clear();
    return readLines(maps, [&](std::string_view lines) { decodeMaps(lines, mappings); });
}

/// Cuts off what an earlier mapping covers: one that grew downwards, or merged, while the list was made.
void putInOrder(std::vector<Mapping>& mappings) {
    std::uint64_t reached = 0;
    for (Mapping& mapping : mappings) {
        if (mapping.start < reached) {
            const std::uint64_t start = std::min(reached, mapping.end);
            mapping.fileOffset += mapping.isFileBacked() ? start - mapping.start : 0;
            mapping.start = start;
        }
        reached = std::max(reached, mapping.end);
    }
    std::erase_if(mappings, [](const Mapping& mapping) { return mapping.start == mapping.end; });
}

} // namespace

bool listMappings(const Descriptor& maps, std::vector<Mapping>* mappings) {
    const bool isListed = listAll(maps, mappings);
    putInOrder(*mappings);
    return isListed;
}

} // namespace tally::platform
