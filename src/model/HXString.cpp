#include "model/HXString.h"

#include "platform/HXAdaptiveMutex.h"

#include <array>
#include <functional>
#include <mutex>
#include <unordered_set>

namespace {

struct TextHash {
    using is_transparent = void;
    size_t operator()(std::string_view text) const { return std::hash<std::string_view>{}(text); }
};

// Sharded, so that workers which intern at the same time seldom wait for each other.
struct Shard {
    HXAdaptiveMutex mutex;
    std::unordered_set<std::string, TextHash, std::equal_to<>> strings;
};

std::array<Shard, 64> &shards() {
    static std::array<Shard, 64> all;
    return all;
}

} // namespace

HXString HXString::intern(std::string_view text) {
    Shard &shard = shards()[(TextHash{}(text) >> 7) % 64];
    const std::lock_guard lock(shard.mutex);
    auto found = shard.strings.find(text);
    if (found == shard.strings.end()) found = shard.strings.emplace(text).first;
    return HXString(&*found);
}

const std::string &HXString::str() const {
    static const std::string empty;
    return _string ? *_string : empty;
}
