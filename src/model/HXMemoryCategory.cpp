#include "model/HXMemoryCategory.h"

#include <algorithm>

bool HXMemoryCategory::isMember(const HXMemoryObject &object) {
    if (_memoryObjects.empty()) return false;
    if (_isAscending && object.index() > _memoryObjects.back()->index()) return false;
    if (_isAscending) {
        _isAscending = false;
        for (const HXMemoryObject::View &member : _memoryObjects)
            _members.insert(member.get());
    }
    return !_members.insert(&object).second;
}

void HXMemoryCategory::addMemoryObject(HXMemoryObject::View object) {
    if (isMember(*object)) return;
    _totalDirtySize += object->totalDirtySize();
    _totalSwappedSize += object->totalSwappedSize();
    _totalCleanSize += object->totalCleanSize();
    _totalReclaimableSize += object->totalReclaimableSize();
    _totalWiredSize += object->totalWiredSize();
    _totalRegions += object->memoryRegions().size();
    _countsRegions = _isAscending;
    _memoryObjects.push_back(std::move(object));
}

int32_t HXMemoryCategory::totalRegions() const {
    if (!_countsRegions) {
        std::vector<const HXMemoryRegion *> regions;
        for (const HXMemoryObject::View &object : _memoryObjects)
            regions.insert(regions.end(), object->memoryRegions().begin(), object->memoryRegions().end());
        std::sort(regions.begin(), regions.end());
        _totalRegions = static_cast<size_t>(std::unique(regions.begin(), regions.end()) - regions.begin());
        _countsRegions = true;
    }
    return static_cast<int32_t>(_totalRegions);
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
