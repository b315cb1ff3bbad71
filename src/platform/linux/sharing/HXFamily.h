// Processes that may share private pages, and how much of their memory each set of them shares.
#pragma once

#include "platform/linux/memory/HXAddressSpace.h"
#include "platform/linux/procfs/HXDescriptor.h"
#include "platform/linux/sharing/HXPageKeys.h"
#include "platform/linux/sharing/HXSharerSets.h"

#include <cstdint>
#include <map>
#include <memory>
#include <span>
#include <tuple>
#include <unordered_map>
#include <vector>

// Numbers of pages; `mapping`: index in the member's address space.
struct HXFamilyRange {
    uint64_t first;
    uint64_t end;
    uint32_t mapping;
    bool isFile;
};

struct HXFamilyMember {
    HXDescriptor pagemap;
    std::vector<HXFamilyRange> ranges; // of private mappings, ascending
};

// What is the same for all who read it, on any thread.
struct HXFamily {
    std::vector<HXFamilyMember> members; // ascending by pid
    std::shared_ptr<const HXPageEntries> entries;
    std::shared_ptr<HXSeenKeys> seen;
};

// An amount of pages.
struct HXPageCount {
    uint64_t resident = 0;
    uint64_t swapped = 0;

    void add(HXPageKey key) { (key & kSwappedKey ? swapped : resident)++; }
    HXPageCount &operator+=(const HXPageCount &other) {
        resident += other.resident;
        swapped += other.swapped;
        return *this;
    }
    uint64_t all() const { return resident + swapped; }
};

// A mapping of a member.
struct HXFamilyMapping {
    uint32_t member;
    uint32_t mapping;
    bool operator<(const HXFamilyMapping &other) const {
        return std::tie(member, mapping) < std::tie(other.member, other.mapping);
    }
};

// What the page tables show of a private mapping, in pages: figures of HXMapping.
struct HXFamilyFigures {
    uint32_t resident = 0;
    uint32_t anonymous = 0;
    uint32_t swapped = 0;

    HXFamilyFigures &operator+=(const HXFamilyFigures &other) {
        resident += other.resident;
        anonymous += other.anonymous;
        swapped += other.swapped;
        return *this;
    }
};

// Where a page was met that lies at more than one place.
struct HXRepeatedPage {
    HXPageKey key;
    HXFamilyMapping place;
    bool operator<(const HXRepeatedPage &other) const {
        return std::tie(key, place) < std::tie(other.key, other.place);
    }
};

// What was read of a family, or of a stretch of its addresses.
struct HXFamilyPages {
    explicit HXFamilyPages(size_t memberCount, size_t setLimit)
        : members(memberCount), sets(memberCount, setLimit), figures(memberCount),
          mayBeLazilyFreed(memberCount), _lastRest(memberCount) {}
    HXFamilyPages(HXFamilyPages &&) = default; // not copied: `_lastRest`
    HXFamilyPages &operator=(HXFamilyPages &&) = default;

    static constexpr uint32_t kNoMapping = UINT32_MAX;
    // How many of the shared pages lie in one mapping of each member: a set's pages in one layout.
    struct Count {
        uint32_t layout;
        uint32_t set;
        HXPageCount pages;
    };
    // What a mapping has of pages whose sets are not told, and how many of these no lower member has.
    struct Rest {
        HXPageCount pages, counted;
    };

    size_t members;
    HXSharerSets sets;
    std::vector<uint32_t> layouts; // the mapping of each member, or kNoMapping, layout by layout
    std::vector<Count> counts;
    std::map<HXFamilyMapping, Rest> rest;
    std::vector<std::vector<std::pair<uint32_t, HXFamilyFigures>>> figures; // of mappings, by member
    std::vector<uint8_t> mayBeLazilyFreed; // by member: whether some of its pages may be
    std::vector<HXPageKey> metAgain;
    std::vector<HXRepeatedPage> repeated;

    std::span<const uint32_t> layout(uint32_t number) const {
        return std::span(layouts).subspan(number * members, members);
    }
    // Counts pages, without their set, whose members have them where `layout` says.
    void addRest(HXSharerSets::Bits set, std::span<const uint32_t> layout, const HXPageCount &pages);
    // Adds what was read elsewhere.
    void add(const HXFamilyPages &other);

  private:
    // Of each member the element of `rest` that was counted last: its pages come mapping by mapping.
    std::vector<std::pair<const HXFamilyMapping, Rest> *> _lastRest;
};
