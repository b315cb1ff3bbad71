#include "model/HXMemoryCategory.h"

#include <algorithm>

namespace {

constexpr size_t kFewNames = 16;

}

HXMemoryCategory &HXCategoryMap::categoryForObject(const HXMemoryObject &object) {
    const HXMemoryRegion &naming = *object._canonicalRegion();
    const HXString detail = _summarize ? HXString() : naming.detailedName();
    const NamePair names = {naming.name().identity(), detail.identity()};
    if (_names.size() <= kFewNames) {
        for (const auto &[known, place] : _names)
            if (known == names) return _categories[place];
    } else if (const auto known = _byName.find(names); known != _byName.end()) {
        return _categories[known->second];
    }

    const size_t place = addCategory(naming, detail);
    _names.emplace_back(names, place);
    if (_names.size() > kFewNames) {
        if (_byName.empty()) _byName.insert(_names.begin(), _names.end());
        _byName.emplace(names, place);
    }
    return _categories[place];
}

// The place of the category of that text, made where there is none.
size_t HXCategoryMap::addCategory(const HXMemoryRegion &naming, HXString detail) {
    std::string fullName = _summarize ? naming.name().str() : naming.fullName();
    const size_t next = _categories.size();
    if (_names.size() < kFewNames) {
        const auto known = std::find_if(_categories.begin(), _categories.end(),
                                        [&](const auto &each) { return each.fullName() == fullName; });
        if (known != _categories.end()) return static_cast<size_t>(known - _categories.begin());
    } else {
        if (_byFullName.empty())
            for (size_t i = 0; i < next; i++)
                _byFullName.emplace(_categories[i].fullName(), i);
        const auto [known, isNew] = _byFullName.try_emplace(fullName, next);
        if (!isNew) return known->second;
    }
    _categories.emplace_back(std::move(fullName), naming.name(), detail);
    return next;
}
