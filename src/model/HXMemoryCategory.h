// One line of a report: the memory objects that share a name, added up.
#pragma once

#include "model/HXMemoryObject.h"

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

class HXMemoryCategory {
  public:
    // `summary`: the category belongs to a summarised report, whose names have no detail.
    explicit HXMemoryCategory(HXSegment segment, bool summary = false)
        : _isSummary(summary), _segment(segment) {}

    // Adds an object's totals and regions; an object that is in the category already changes nothing.
    void addMemoryObject(HXMemoryObject::View object);

    HXSegment segment() const { return _segment; }
    const std::vector<HXMemoryObject::View> &memoryObjects() const { return _memoryObjects; }
    // Bytes.
    uint64_t totalDirtySize() const { return _totalDirtySize; }
    uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    uint64_t totalCleanSize() const { return _totalCleanSize; }
    uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    uint64_t totalWiredSize() const { return _totalWiredSize; }
    // The number of different regions of all objects.
    int32_t totalRegions() const;

    // Gives the category the name that its objects were chosen by. Views of an object may be made of regions
    // that other processes call otherwise.
    void setNaming(HXString name, HXString detailedName);

    // Those given, else those of the first object; none without either.
    HXString name() const;
    // None for a summary category.
    HXString detailedName() const;
    std::string fullName() const;

  private:
    bool isMember(const HXMemoryObject &object);

    bool _isSummary;
    HXSegment _segment;
    bool _isNamed = false;
    HXString _name;
    HXString _detailedName;
    std::vector<HXMemoryObject::View> _memoryObjects;
    // Objects of an analysis come by ascending index, so that each is new and shares no region with those
    // before. Once one breaks the order, members are looked up and regions counted one by one.
    bool _isAscending = true;
    std::unordered_set<const HXMemoryObject *> _members;
    uint64_t _totalDirtySize = 0;
    uint64_t _totalSwappedSize = 0;
    uint64_t _totalCleanSize = 0;
    uint64_t _totalReclaimableSize = 0;
    uint64_t _totalWiredSize = 0;
    mutable size_t _totalRegions = 0;
    mutable bool _countsRegions = true; // whether _totalRegions is up to date
};

// Categories by key (name or full name), in the order in which the keys came.
class HXCategoryMap {
  public:
    struct Entry {
        std::string key;
        std::unique_ptr<HXMemoryCategory> category;
    };

    // The category of an object's name: made with the segment code given when there is none yet.
    HXMemoryCategory &categoryForObject(const HXMemoryObject &object, HXSegment segment, bool summarize);
    const std::vector<Entry> &entries() const { return _entries; }
    // The category of a key, or null.
    const HXMemoryCategory *get(const std::string &key) const;

  private:
    struct NamePair {
        const void *name;
        const void *detail;
        bool operator==(const NamePair &) const = default;
    };
    struct NamePairHash {
        size_t operator()(const NamePair &pair) const {
            return std::hash<const void *>{}(pair.name) * 31 + std::hash<const void *>{}(pair.detail);
        }
    };

    std::vector<Entry> _entries;
    std::unordered_map<std::string, size_t> _byKey;
    // Spares making the key text for every object: strings are interned, so equal names are the same name.
    std::unordered_map<NamePair, size_t, NamePairHash> _byName;
};
