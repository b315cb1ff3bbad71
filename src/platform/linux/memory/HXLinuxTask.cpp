#include "platform/linux/memory/HXLinuxTask.h"

#include "platform/linux/memory/HXRepeatedPages.h"
#include "platform/linux/memory/HXTaskFiles.h"

#include <mutex>

const HXAddressSpace &HXLinuxTask::addressSpace(const HXReaderSetting &setting, bool needsDirtyPages) {
    if (!_addressSpace || (needsDirtyPages && !_addressSpace->knowsDirtyPages)) {
        _addressSpace = HXReadAddressSpace({_directory, _status, needsDirtyPages, _opened}, setting);
        _pages.emplace(_directory, setting.pageShift);
        HXFindRepeatedPages(setting.pageShift, &*_pages, _addressSpace.get());
    }
    return *_addressSpace;
}

size_t HXLinuxTask::find(uint64_t address) {
    _cursor = _addressSpace->find(address, _cursor);
    return _cursor;
}

std::optional<HXStatusRecord> HXLinuxTask::status(StatusUse use) {
    bool &used = _used[use == StatusUse::ledger];
    if (!_status || used) {
        _status = HXReadStatus(_directory);
        _used[0] = _used[1] = false;
    }
    used = true;
    return _status;
}

uint32_t HXTaskTable::add(std::unique_ptr<HXLinuxTask> task) {
    const std::unique_lock lock(_mutex);
    const uint32_t port = _nextPort++;
    _portsByPid[task->pid()] = port;
    _tasks[port] = std::move(task);
    return port;
}

void HXTaskTable::remove(uint32_t port) {
    const std::unique_lock lock(_mutex);
    const auto found = _tasks.find(port);
    if (found == _tasks.end()) return;
    const auto byPid = _portsByPid.find(found->second->pid());
    if (byPid != _portsByPid.end() && byPid->second == port) _portsByPid.erase(byPid);
    _tasks.erase(found);
}

HXLinuxTask *HXTaskTable::find(uint32_t port) const {
    const std::shared_lock lock(_mutex);
    const auto found = _tasks.find(port);
    return found == _tasks.end() ? nullptr : found->second.get();
}

HXLinuxTask *HXTaskTable::findByPid(int32_t pid) const {
    const std::shared_lock lock(_mutex);
    const auto found = _portsByPid.find(pid);
    return found == _portsByPid.end() ? nullptr : _tasks.at(found->second).get();
}
