// One line of a report: the memory objects that share a name, added up.
#pragma once

#include "model/HXMemoryObject.h"

#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

// It keeps the name of the object that it was made for: views of objects can be made of regions that other
// processes call otherwise.
class HXMemoryCategory {
  public:
    // `fullName` is the key that objects are chosen by. Without a detail in a summarised report.
    HXMemoryCategory(std::string fullName, HXString name, HXString detailedName)
        : _fullName(std::move(fullName)), _name(name), _detailedName(detailedName) {}

    // Adds an object as it is seen. An object enters a category once, so no region is counted twice.
    void addMemoryObject(const HXMemoryObjectView &view) { _total += view; }

    const HXMemoryTotal &total() const { return _total; }
    const std::string &fullName() const { return _fullName; }
    HXString name() const { return _name; }
    HXString detailedName() const { return _detailedName; }

  private:
    std::string _fullName;
    HXString _name;
    HXString _detailedName;
    HXMemoryTotal _total;
};

// Categories by full name, in the order in which the names came.
class HXCategoryMap {
  public:
    // With `summarize` names have no detail.
    explicit HXCategoryMap(bool summarize = false) : _summarize(summarize) {}

    // The category of an object's name, made when there is none yet. Valid until the next one is made.
    HXMemoryCategory &categoryForObject(const HXMemoryObject &object);

    const std::vector<HXMemoryCategory> &categories() const { return _categories; }

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

    size_t addCategory(const HXMemoryRegion &naming, HXString detail);

    bool _summarize;
    std::vector<HXMemoryCategory> _categories;
    // Spares making the full name for every object: strings are interned, so equal names are the same name.
    // Other names can make the same text. Where there are few, as in most maps, they are looked through.
    std::vector<std::pair<NamePair, size_t>> _names;
    // Made for larger maps only.
    std::unordered_map<NamePair, size_t, NamePairHash> _byName;
    std::unordered_map<std::string, size_t> _byFullName;
};
