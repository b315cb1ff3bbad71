#include "platform/linux/pages/HXLinuxTask.h"

#include "platform/linux/pages/HXRepeatedPages.h"
#include "platform/linux/procfs/HXTaskFiles.h"

#include <algorithm>
#include <cerrno>
#include <mutex>
#include <utility>

bool HXDescriptorTurns::run(const std::function<void()> &read) {
    {
        const std::shared_lock lock(_mutex);
        const HXShortageWatch watch;
        read();
        if (!watch.seen()) return true;
    }
    // Somebody who reads may be stuck.
    const std::unique_lock lock(_mutex, std::chrono::seconds(1));
    if (!lock) return false;
    const HXShortageWatch watch;
    read();
    return !watch.seen();
}

HXLinuxTask::HXLinuxTask(int32_t pid, uint32_t number, HXOpenProcess process, HXDescriptor maps,
                         bool keepsOpen, HXLinuxProcesses &processes, HXDescriptorTurns &turns)
    : _pid(pid), _number(number), _startTime(process.stat.startTime), _startStack(process.stat.startStack),
      _processes(processes), _turns(turns), _status(HXReadStatus(process.directory)),
      _residentSize(_status ? _status->residentSize.value_or(0) : 0) {
    if (!keepsOpen) return;
    _directory = std::move(process.directory);
    _maps = std::move(maps);
}

// Not open with errno set.
HXDescriptor HXLinuxTask::reopen() {
    auto process = _processes.open(_pid);
    if (!process) return {};
    if (process->stat.startTime == _startTime) return std::move(process->directory);
    errno = ESRCH;
    return {};
}

bool HXLinuxTask::withDescriptors(const std::function<void()> &read) {
    const bool suffice = _turns.run(read);
    if (!suffice && _addressSpace) _addressSpace->endError = KERN_RESOURCE_SHORTAGE;
    return suffice;
}

const HXAddressSpace &HXLinuxTask::addressSpace(const HXReaderSetting &setting, bool needsDirtyPages) {
    if (_awaitsSettling) settle(setting);
    if (!_addressSpace || (needsDirtyPages && !_addressSpace->knowsDirtyPages)) {
        _shares.clear(); // by their mappings' places among those of an earlier reading
        withDescriptors([&] { read(setting, needsDirtyPages); });
        finishReading(setting);
    }
    return *_addressSpace;
}

void HXLinuxTask::finishReading(const HXReaderSetting &setting) {
    _pages.emplace(_directory, setting.pageShift);
    withDescriptors([&] { HXFindRepeatedPages(setting.pageShift, &*_pages, _addressSpace.get()); });
}

void HXLinuxTask::readForSharing(const HXReaderSetting &setting, bool needsDirtyPages, bool leavesLazyFree) {
    if (!_directory) _directory = reopen();
    _addressSpace = HXReadAddressSpace(
        {_directory, _status, needsDirtyPages, _opened, true, leavesLazyFree, &_maps}, setting);
    _maps.reset();
}

void HXLinuxTask::takeShared(HXSharedPages shared) {
    HXAddressSpace &addressSpace = *_addressSpace;
    for (const HXSharedPages::Figures &figures : shared.figures) {
        if (!addressSpace.lacksPrivatePages) break;
        HXMapping &mapping = addressSpace[figures.mapping];
        mapping.residentPages += figures.resident;
        mapping.anonymousPages += figures.anonymous;
        mapping.swappedPages += figures.swapped;
    }
    addressSpace.lacksPrivatePages = false;
    for (const HXSharedPages::Repeated &repeated : shared.repeated) {
        addressSpace[repeated.mapping].repeatedPages += repeated.resident;
        addressSpace[repeated.mapping].repeatedSwappedPages += repeated.swapped;
    }
    _shares = std::move(shared.shares);
    _mayBeLazilyFreed = shared.mayBeLazilyFreed;
    _awaitsSettling = true;
}

// Whether what was found holds is for the thread that then asks for it to see: another process may keep it
// waiting. Where it does not, the pages are read once more, as the process's own.
void HXLinuxTask::settle(const HXReaderSetting &setting) {
    _awaitsSettling = false;
    // Page tables that were opened after the process had executed another program are not of these mappings.
    const auto stat = HXReadStat(_directory);
    compare(setting, true);
    const bool isSame = stat && stat->startStack == _startStack && !_difference;
    if (!isSame || (_mayBeLazilyFreed && !readLazilyFreed(setting)))
        forget();
    else
        finishReading(setting);
}

// Takes the figures of smaps instead, if they are still of the same mappings.
bool HXLinuxTask::readLazilyFreed(const HXReaderSetting &setting) {
    auto read = HXReadAddressSpace({_directory, _status, true, _opened}, setting);
    if (read->endError != KERN_INVALID_ADDRESS || read->count() != _addressSpace->count()) return false;
    for (size_t i = 0; i < read->count(); i++) {
        const HXMapping &before = (*_addressSpace)[i];
        HXMapping &mapping = (*read)[i];
        if (mapping.start != before.start || mapping.end != before.end) return false;
        mapping.repeatedPages = before.repeatedPages;
        mapping.repeatedSwappedPages = before.repeatedSwappedPages;
    }
    _addressSpace = std::move(read);
    return true;
}

std::vector<vm_region_share> HXLinuxTask::sharesOf(size_t index) const {
    std::vector<vm_region_share> found;
    auto share = std::partition_point(_shares.begin(), _shares.end(),
                                      [&](const auto &each) { return each.mapping < index; });
    for (; share != _shares.end() && share->mapping == index; ++share)
        found.push_back(share->share);
    return found;
}

void HXLinuxTask::read(const HXReaderSetting &setting, bool needsDirtyPages) {
    if (!_directory) _directory = reopen();
    readOnce(setting, needsDirtyPages);
    compare(setting, true);
    if (!_difference) return;
    readOnce(setting, needsDirtyPages);
    compare(setting, false);
}

void HXLinuxTask::readOnce(const HXReaderSetting &setting, bool needsDirtyPages) {
    _addressSpace =
        HXReadAddressSpace({_directory, _status, needsDirtyPages, _opened, false, false, &_maps}, setting);
    _maps.reset();
}

// The first reading is compared with the counters behind it alone, so that most processes cost one more small
// file, which also answers the next question for the status.
void HXLinuxTask::compare(const HXReaderSetting &setting, bool isFirst) {
    _difference.reset();
    if (_addressSpace->endError != KERN_INVALID_ADDRESS || _addressSpace->count() == 0) return;
    const auto before = std::exchange(_status, HXReadStatus(_directory));
    _used[0] = _used[1] = false;
    if (!_status) return;
    const uint64_t error = setting.machine->counterErrorPages(_status->threadCount.value_or(1));
    _difference = HXFindWalkDifference(*_addressSpace, isFirst || !before ? *_status : *before, *_status,
                                       {setting.pageShift, error << setting.pageShift});
}

size_t HXLinuxTask::find(uint64_t address) {
    _cursor = _addressSpace->find(address, _cursor);
    return _cursor;
}

std::optional<HXStatusRecord> HXLinuxTask::status(StatusUse use) {
    bool &used = _used[use == StatusUse::ledger];
    if (!_status || used) {
        const HXDescriptor reopened = _directory ? HXDescriptor() : reopen();
        if (!_directory && !reopened) return std::nullopt;
        _status = HXReadStatus(_directory ? _directory : reopened);
        _used[0] = _used[1] = false;
    }
    used = true;
    return _status;
}

namespace {

// What this thread asked for last: it asks for one task again and again while that is open.
struct LastFound {
    uint64_t table = 0;
    uint32_t port = 0;
    HXLinuxTask *task = nullptr;
};
thread_local LastFound last;

} // namespace

uint32_t HXTaskTable::add(std::unique_ptr<HXLinuxTask> task) {
    const std::lock_guard lock(_mutex);
    const uint32_t port = _nextPort++;
    _portsByPid[task->pid()] = port;
    _tasks[port] = std::move(task);
    return port;
}

void HXTaskTable::remove(uint32_t port) {
    if (last.port == port) last = {};
    std::unique_ptr<HXLinuxTask> removed; // destroyed behind the lock: others look for theirs meanwhile
    const std::lock_guard lock(_mutex);
    const auto found = _tasks.find(port);
    if (found == _tasks.end()) return;
    removed = std::move(found->second);
    const auto byPid = _portsByPid.find(removed->pid());
    if (byPid != _portsByPid.end() && byPid->second == port) _portsByPid.erase(byPid);
    _tasks.erase(found);
}

size_t HXTaskTable::count() const {
    const std::lock_guard lock(_mutex);
    return _tasks.size();
}

std::vector<HXLinuxTask *> HXTaskTable::all() const {
    const std::lock_guard lock(_mutex);
    std::vector<HXLinuxTask *> all;
    for (const auto &[pid, port] : _portsByPid)
        all.push_back(_tasks.at(port).get());
    std::sort(all.begin(), all.end(),
              [](const HXLinuxTask *a, const HXLinuxTask *b) { return a->pid() < b->pid(); });
    return all;
}

HXLinuxTask *HXTaskTable::find(uint32_t port) const {
    if (last.table == _number && last.port == port) return last.task;
    const std::lock_guard lock(_mutex);
    const auto found = _tasks.find(port);
    if (found == _tasks.end()) return nullptr;
    last = {_number, port, found->second.get()};
    return last.task;
}

HXLinuxTask *HXTaskTable::findByPid(int32_t pid) const {
    const std::lock_guard lock(_mutex);
    const auto found = _portsByPid.find(pid);
    return found == _portsByPid.end() ? nullptr : _tasks.at(found->second).get();
}
