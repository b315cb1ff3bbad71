// User tags of the host's own (100 and up): what kind of memory a mapping holds, beyond the tags that every
// host has.
#pragma once

#include <cstdint>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

enum HXHostTag : uint32_t {
    HXHostTagStack = 30,
    HXHostTagGuard = 31,
    HXHostTagHeap = 100,
    HXHostTagAnonymous = 101,
    HXHostTagAnonymousCode = 102,
    HXHostTagSharedAnonymous = 103,
    HXHostTagSystemVSharedMemory = 104,
    HXHostTagHugePages = 105,
    HXHostTagMemfd = 106,
    HXHostTagDeletedSharedMemory = 107,
    HXHostTagFirstNamed = 110,
    HXHostTagLastNamed = 239,
};

// The host's fixed names of tags 100 to 107; none for other tags.
std::optional<std::string_view> HXHostTagName(uint32_t tag);

// The tags 110 to 239, given to the names by which programs call their memory in the order in which the names
// appear in a run.
class HXNamedTags {
  public:
    // The tag of `name` (safe text), taking a free one for a new name; none when all are taken.
    std::optional<uint32_t> tagForName(std::string_view name);
    // The name that was given `tag`; none when the tag is free.
    std::optional<std::string> nameForTag(uint32_t tag) const;

  private:
    mutable std::mutex _mutex;
    std::map<std::string, uint32_t, std::less<>> _tags;
    std::vector<std::string> _names;
};
