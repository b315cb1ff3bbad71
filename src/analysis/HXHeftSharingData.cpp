#include "analysis/HXHeftSharingData.h"

const HXHeftSharingData::Groups *HXHeftSharingData::groupsOfProcess(int32_t pid) const {
    const auto found = processToProcessGroups.find(pid);
    return found == processToProcessGroups.end() ? nullptr : &found->second;
}
