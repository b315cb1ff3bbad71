#include "model/HXProcessGroup.h"

#include "platform/HXInternalError.h"

void HXProcessGroup::addProcess(const HXRegionOwner &process) {
    HXRequire(!_immutable, "HXProcessGroup addProcess", "!_immutable");
    if (!_pids.insert(process.pid()).second) return;
    _hashValue = (_hashValue * 37) ^ static_cast<uint32_t>(process.pid());
    _processes.push_back(&process);
}

bool HXProcessGroup::isEqual(const HXProcessGroup &other) const {
    if (!other._immutable) return _pids == other._pids;
    HXRequire(_immutable, "HXProcessGroup isEqual", "self->_immutable");
    return this == &other;
}

std::string HXProcessGroup::description() const {
    std::string text = "HXProcessGroup{(";
    for (const HXRegionOwner *process : _processes) {
        if (process != _processes.front()) text += ", ";
        text += process->description();
    }
    return text + ")}";
}
