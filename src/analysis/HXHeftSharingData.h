// Who shares what with whom.
#pragma once

#include "analysis/HXProcessGroup.h"
#include "model/HXMemoryObject.h"

#include <cstdint>
#include <deque>
#include <memory>
#include <unordered_map>
#include <vector>

// The objects of an analysis: addresses stay as it grows.
using HXMemoryObjects = std::deque<HXMemoryObject>;

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
    // The objects themselves, once the report has taken them from the analysis.
    std::unique_ptr<HXMemoryObjects> objects;
};
