#include "platform/linux/memory/HXLinuxTask.h"

const HXAddressSpace &HXLinuxTask::addressSpace(const HXReaderSetting &setting, bool needsDirtyPages) {
    if (!_addressSpace || (needsDirtyPages && !_addressSpace->knowsDirtyPages)) {
        _addressSpace = HXReadAddressSpace({directory(), _status, needsDirtyPages, _opened}, setting);
        _pages.reset();
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
        _status = HXReadStatus(directory());
        _used[0] = _used[1] = false;
    }
    used = true;
    return _status;
}

HXTaskTable::~HXTaskTable() {
    for (auto &slot : _chunks) {
        const std::unique_ptr<Chunk> chunk(slot.load());
        if (!chunk) break;
        for (auto &task : *chunk)
            delete task.load();
    }
}

uint32_t HXTaskTable::add(std::unique_ptr<HXLinuxTask> task) {
    const std::lock_guard lock(_mutex);
    if (_count == chunkLength * chunkCount) return 0;
    const uint32_t index = _count++;
    std::atomic<Chunk *> &slot = _chunks[index / chunkLength];
    if (slot.load() == nullptr) slot = std::make_unique<Chunk>().release();
    _portsByPid[task->pid()] = firstPort + index;
    (*slot.load())[index % chunkLength].store(task.release(), std::memory_order_release);
    return firstPort + index;
}

HXLinuxTask *HXTaskTable::find(uint32_t port) const {
    const uint32_t index = port - firstPort;
    if (port < firstPort || index >= chunkLength * chunkCount) return nullptr;
    const Chunk *chunk = _chunks[index / chunkLength].load(std::memory_order_acquire);
    return chunk == nullptr ? nullptr : (*chunk)[index % chunkLength].load(std::memory_order_acquire);
}

void HXTaskTable::remove(uint32_t port) {
    const std::lock_guard lock(_mutex);
    const std::unique_ptr<HXLinuxTask> task(find(port));
    if (!task) return;
    const uint32_t index = port - firstPort;
    (*_chunks[index / chunkLength].load())[index % chunkLength] = nullptr;
    const auto found = _portsByPid.find(task->pid());
    if (found != _portsByPid.end() && found->second == port) _portsByPid.erase(found);
}

HXLinuxTask *HXTaskTable::findByPid(int32_t pid) const {
    uint32_t port;
    {
        const std::lock_guard lock(_mutex);
        const auto found = _portsByPid.find(pid);
        if (found == _portsByPid.end()) return nullptr;
        port = found->second;
    }
    return find(port);
}
