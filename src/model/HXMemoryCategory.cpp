#include "model/HXMemoryCategory.h"

#include <algorithm>

void HXMemoryCategory::addMemoryObject(HXMemoryObject::View object) {
    if (!_memoryObjects.empty()) {
        if (_members.empty()) _members.insert(_memoryObjects.front().get());
        if (!_members.insert(object.get()).second) return;
    }
    _totalDirtySize += object->totalDirtySize();
    _totalSwappedSize += object->totalSwappedSize();
    _totalCleanSize += object->totalCleanSize();
    _totalReclaimableSize += object->totalReclaimableSize();
    _totalWiredSize += object->totalWiredSize();
    _totalRegions = -1;
    _memoryObjects.push_back(std::move(object));
}

// An analysed region belongs to one object, and views hold regions of the object that they are views of:
// objects of different origin have no region in common.
bool HXMemoryCategory::objectsHaveDifferentOrigins() const {
    std::vector<const HXMemoryObject *> origins;
    origins.reserve(_memoryObjects.size());
    for (const HXMemoryObject::View &object : _memoryObjects) {
        const auto regions = object->memoryRegions();
        const HXMemoryObject *origin = regions.empty() ? nullptr : regions.front()->memoryObject();
        if (!origin) return false;
        origins.push_back(origin);
    }
    std::sort(origins.begin(), origins.end());
    return std::adjacent_find(origins.begin(), origins.end()) == origins.end();
}

int32_t HXMemoryCategory::totalRegions() const {
    if (_totalRegions >= 0) return _totalRegions;
    if (objectsHaveDifferentOrigins()) {
        size_t count = 0;
        for (const HXMemoryObject::View &object : _memoryObjects)
            count += object->memoryRegions().size();
        return _totalRegions = static_cast<int32_t>(count);
    }
    std::vector<const HXMemoryRegion *> regions;
    for (const HXMemoryObject::View &object : _memoryObjects)
        regions.insert(regions.end(), object->memoryRegions().begin(), object->memoryRegions().end());
    std::sort(regions.begin(), regions.end());
    return _totalRegions =
               static_cast<int32_t>(std::unique(regions.begin(), regions.end()) - regions.begin());
}

void HXMemoryCategory::setNaming(HXString name, HXString detailedName) {
    _isNamed = true;
    _name = name;
    _detailedName = detailedName;
}

HXString HXMemoryCategory::name() const {
    if (_isNamed) return _name;
    return _memoryObjects.empty() ? HXString() : _memoryObjects.front()->name();
}

HXString HXMemoryCategory::detailedName() const {
    if (_isSummary) return HXString();
    if (_isNamed) return _detailedName;
    return _memoryObjects.empty() ? HXString() : _memoryObjects.front()->detailedName();
}

std::string HXMemoryCategory::fullName() const {
    const HXString detail = detailedName();
    return detail.isEmpty() ? name().str() : name().str() + " " + detail.str();
}

HXMemoryCategory &HXCategoryMap::categoryForObject(const HXMemoryObject &object, HXSegment segment,
                                                   bool summarize) {
    const HXMemoryRegion &naming = *object._canonicalRegion();
    const NamePair names = {naming.name().identity(), summarize ? nullptr : naming.detailedName().identity()};
    const auto known = _byName.find(names);
    if (known != _byName.end()) return *_entries[known->second].category;

    std::string key = summarize ? naming.name().str() : naming.fullName();
    const auto [position, isNew] = _byKey.try_emplace(key, _entries.size());
    if (isNew) {
        _entries.push_back({std::move(key), std::make_unique<HXMemoryCategory>(segment, summarize)});
        _entries.back().category->setNaming(naming.name(), naming.detailedName());
    }
    _byName.emplace(names, position->second);
    return *_entries[position->second].category;
}

const HXMemoryCategory *HXCategoryMap::get(const std::string &key) const {
    const auto found = _byKey.find(key);
    return found == _byKey.end() ? nullptr : _entries[found->second].category.get();
}
