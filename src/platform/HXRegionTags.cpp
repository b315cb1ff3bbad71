#include "platform/HXRegionTags.h"

std::optional<std::string_view> HXHostTagName(uint32_t tag) {
    static constexpr std::string_view names[] = {
        "heap",       "anonymous", "anonymous code",        "shared anonymous", "System V shared memory",
        "huge pages", "memfd",     "deleted shared memory",
    };
    if (tag < HXHostTagHeap || tag > HXHostTagDeletedSharedMemory) return std::nullopt;
    return names[tag - HXHostTagHeap];
}

std::optional<uint32_t> HXNamedTags::tagForName(std::string_view name) {
    const std::lock_guard lock(_mutex);
    const auto found = _tags.find(name);
    if (found != _tags.end()) return found->second;
    const uint32_t tag = HXHostTagFirstNamed + static_cast<uint32_t>(_names.size());
    if (tag > HXHostTagLastNamed) return std::nullopt;
    _names.emplace_back(name);
    _tags.emplace(name, tag);
    return tag;
}

std::optional<std::string> HXNamedTags::nameForTag(uint32_t tag) const {
    const std::lock_guard lock(_mutex);
    if (tag < HXHostTagFirstNamed || tag - HXHostTagFirstNamed >= _names.size()) return std::nullopt;
    return _names[tag - HXHostTagFirstNamed];
}
