// Who shares what with whom.
#pragma once

#include "model/HXMemoryObject.h"
#include "model/HXProcessGroup.h"

#include <cstdint>
#include <deque>
#include <memory_resource>
#include <unordered_map>
#include <vector>

// The objects of an analysis: addresses stay as it grows. They are taken from memory in bulk and given back
// at once.
class HXMemoryObjects {
  public:
    HXMemoryObject &add() {
        HXMemoryObject &object = _objects.emplace_back();
        object.setIndex(static_cast<uint32_t>(_objects.size() - 1));
        return object;
    }
    size_t size() const { return _objects.size(); }
    HXMemoryObject &operator[](size_t index) { return _objects[index]; }
    auto begin() { return _objects.begin(); }
    auto end() { return _objects.end(); }
    auto begin() const { return _objects.begin(); }
    auto end() const { return _objects.end(); }

  private:
    std::pmr::monotonic_buffer_resource _memory;
    std::pmr::deque<HXMemoryObject> _objects{&_memory};
};

class HXHeftSharingData {
  public:
    using Groups = std::vector<const HXProcessGroup *>;
    using Objects = std::vector<const HXMemoryObject *>;

    // The groups of a process, its own group first where it has one; null when nothing it maps was counted.
    const Groups *groupsOfProcess(int32_t pid) const;
    // The objects that exactly this group maps.
    const Objects &objectsOfGroup(const HXProcessGroup &group) const {
        return processGroupToObjects.at(&group);
    }

    std::unordered_map<int32_t, Groups> processToProcessGroups;
    std::unordered_map<const HXProcessGroup *, Objects> processGroupToObjects;
    // All groups, by their first object.
    std::deque<HXProcessGroup> groups;
};
