#include "platform/capture/HXMachine.h"

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
