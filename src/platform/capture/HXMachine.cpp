#include "platform/capture/HXMachine.h"

#include "platform/capture/HXRegionFields.h"

#include <cstring>
#include <tuple>

bool HXMachineRegionTraits::operator<(const HXMachineRegionTraits &other) const {
    const int order = std::memcmp(&info, &other.info, sizeof info);
    return order != 0 ? order < 0
                      : std::tie(purge, shortRecord, heftOnly) <
                            std::tie(other.purge, other.shortRecord, other.heftOnly);
}

vm_region_submap_info_64 HXMachine::info(const HXMachineRegion &region) const {
    vm_region_submap_info_64 info = traits(region).info;
    const HXMachineRegionExtra &few = extra(region);
    HXForEachRegionField([&](auto each) {
        constexpr HXRegionField field = kRegionFields[each];
        if constexpr (field.own.exists()) field.machine.member.set(&info, field.own.of(&region));
        if constexpr (field.extra.exists()) field.machine.member.set(&info, field.extra.of(&few));
    });
    return info;
}

const HXMachineProcess *HXMachine::process(int32_t pid) const {
    const auto found = processIndices.find(pid);
    return found == processIndices.end() ? nullptr : &processes[found->second];
}

const HXMachineSymbol *HXMachine::symbol(uint64_t address) const {
    auto next = symbols.upper_bound(address);
    if (next == symbols.begin()) return nullptr;
    --next;
    return address - next->first < next->second.size ? &next->second : nullptr;
}
