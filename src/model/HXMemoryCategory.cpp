#include "model/HXMemoryCategory.h"

HXMemoryCategory &HXCategoryMap::categoryForObject(const HXMemoryObject &object) {
    const HXMemoryRegion &naming = *object._canonicalRegion();
    const HXString detail = _summarize ? HXString() : naming.detailedName();
    const NamePair names = {naming.name().identity(), detail.identity()};
    const auto known = _byName.find(names);
    if (known != _byName.end()) return _categories[known->second];

    // Other names can make the same text.
    std::string fullName = _summarize ? naming.name().str() : naming.fullName();
    const auto [place, isNew] = _byFullName.try_emplace(fullName, _categories.size());
    if (isNew) _categories.emplace_back(std::move(fullName), naming.name(), detail);
    _byName.emplace(names, place->second);
    return _categories[place->second];
}
