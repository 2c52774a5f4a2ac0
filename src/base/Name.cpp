#include "base/Name.h"

#include <array>
#include <functional>
#include <mutex>
#include <unordered_set>

namespace tally {

namespace {

struct TextHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view text) const { return std::hash<std::string_view>()(text); }
};

// Sharded by hash, so that workers that intern different texts rarely wait for each other.
struct Shard {
    std::mutex mutex;
    std::unordered_set<std::string, TextHash, std::equal_to<>> texts; // node-based: texts never move
};

Shard& shardOf(std::string_view text) {
    static std::array<Shard, 16> shards;
    return shards[TextHash()(text) >> 7 & 15];
}

} // namespace

Name::Name(std::string_view text) {
    Shard& shard = shardOf(text);
    const std::scoped_lock lock(shard.mutex);
    auto found = shard.texts.find(text);
    if (found == shard.texts.end()) {
        found = shard.texts.emplace(text).first;
    }
    text_ = &*found;
}

} // namespace tally
