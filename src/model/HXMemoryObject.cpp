#include "model/HXMemoryObject.h"

#include "model/HXHeftSwitches.h"
#include "model/HXRegionOwner.h"

#include <algorithm>

void HXRegionSet::add(HXMemoryRegion *region) {
    if (!_first) {
        _first = region;
        return;
    }
    if (!_all) _all = std::make_unique<std::vector<HXMemoryRegion *>>(1, _first);
    _all->push_back(region);
}

std::span<HXMemoryRegion *const> HXRegionSet::regions() const {
    if (_borrowed) return _borrowed->regions();
    if (_all) return *_all;
    return {&_first, _first ? 1U : 0U};
}

std::span<const HXMemoryObject::ProcessRegion> HXMemoryObject::processMemoryRegions() const {
    if (!_processMemoryRegions) return {};
    return *_processMemoryRegions;
}

void HXMemoryObject::addRegion(HXMemoryRegion &region, const HXRegionOwner &process) {
    _addRegion(region, process.pageSize(), &process);
}

void HXMemoryObject::addRegion(HXMemoryRegion &region, uint32_t pageSize) {
    _addRegion(region, pageSize, nullptr);
}

void HXMemoryObject::_addRegion(HXMemoryRegion &region, uint32_t pageSize, const HXRegionOwner *process) {
    HXRequire(!_accurateSizes, "HXMemoryObject addRegion", "!_accurateSizes");
    _memoryRegions.add(&region);
    if (region.object_id() == 0) return; // remembered, but without a share in the sizes
    if (process && (_processMemoryRegions || region.eligibleForProcessView())) {
        if (!_processMemoryRegions) _processMemoryRegions = std::make_unique<std::vector<ProcessRegion>>();
        _processMemoryRegions->push_back({process->pid(), &region});
    }
    addRuns(region, pageSize);
    region.freeSubrangeList();
}

void HXMemoryObject::addRuns(HXMemoryRegion &region, uint32_t pageSize) {
    if (!_rangeList && !_onlyRun) {
        _rangeList = region.takeSubrangeList();
        if (_rangeList) return;
        _onlyRun = &region;
        _onlyRunPageSize = pageSize;
        return;
    }
    if (!_rangeList) {
        _rangeList = std::make_unique<HXRangeList>();
        _rangeList->addRegion(*_onlyRun, _onlyRunPageSize);
        _onlyRun = nullptr;
    }
    _rangeList->addRegion(region, pageSize);
}

HXMemoryTotal HXMemoryObject::sumOfRuns() const {
    if (_rangeList) return _rangeList->sum();
    if (!_onlyRun) return {};
    return {.dirty = _onlyRun->dirtySize(),
            .swapped = _onlyRun->swappedSize(),
            .clean = _onlyRun->cleanNonSpecSize(),
            .reclaimable = _onlyRun->reclaimableSize(),
            .wired = _onlyRun->wiredSize()};
}

template <typename Each>
void HXMemoryObject::forEachProcess(Each each) const {
    const std::span<const ProcessRegion> all = processMemoryRegions();
    for (size_t first = 0, next = 0; first < all.size(); first = next) {
        while (next < all.size() && all[next].pid == all[first].pid)
            next++;
        each(all.subspan(first, next - first));
    }
}

// With the kernel's charge for each region, an object holds at least what any one process is charged for it.
void HXMemoryObject::raiseToLargestProcess() {
    forEachProcess([this](std::span<const ProcessRegion> regions) {
        uint64_t dirty = 0;
        uint64_t swapped = 0;
        for (const ProcessRegion &entry : regions) {
            dirty += entry.region->dirtySize();
            swapped += entry.region->swappedSize();
        }
        _totalDirtySize = std::max(_totalDirtySize, dirty);
        _totalSwappedSize = std::max(_totalSwappedSize, swapped);
    });
}

bool HXMemoryObject::processRegionsTellMore() const {
    size_t processes = 0;
    bool anyDiffers = false;
    forEachProcess([&](std::span<const ProcessRegion> regions) {
        processes++;
        const HXMemoryRegion &region = *regions.front().region;
        anyDiffers =
            anyDiffers || regions.size() > 1 || region.dirtySize() != _totalDirtySize ||
            region.swappedSize() != _totalSwappedSize || region.cleanNonSpecSize() != _totalCleanSize ||
            region.reclaimableSize() != _totalReclaimableSize || region.wiredSize() != _totalWiredSize;
    });
    return processes >= 2 && anyDiffers;
}

void HXMemoryObject::finalizeUsingRegionDirtySize(bool useRegionSizes) {
    HXRequire(!_accurateSizes, "HXMemoryObject finalize", "!_accurateSizes");
    const HXMemoryTotal total = sumOfRuns();
    _totalCleanSize = total.clean;
    _totalReclaimableSize = total.reclaimable;
    _totalWiredSize = total.wired;
    if (_processMemoryRegions)
        std::stable_sort(_processMemoryRegions->begin(), _processMemoryRegions->end(),
                         [](const ProcessRegion &a, const ProcessRegion &b) { return a.pid < b.pid; });
    if (useRegionSizes) {
        for (const HXMemoryRegion *region : memoryRegions()) {
            _totalDirtySize += region->dirtySize();
            _totalSwappedSize += region->swappedSize();
        }
    } else {
        _totalDirtySize = total.dirty;
        _totalSwappedSize = total.swapped;
        if (HXHeftSwitches::breakDownPhysHeft()) raiseToLargestProcess();
    }
    _rangeList.reset();
    _onlyRun = nullptr;
    if (!processRegionsTellMore()) _processMemoryRegions.reset();
    nameFakeRegions();
    _accurateSizes = true;
}

// Unmapped owned memory is named after the object's mapped regions.
void HXMemoryObject::nameFakeRegions() {
    if (!containsFakeRegion()) return;
    const HXMemoryRegion *canonical = _canonicalRegion();
    if (canonical->isFake()) return;
    for (HXMemoryRegion *region : memoryRegions()) {
        if (!region->isFake()) continue;
        region->setName(canonical->name());
        region->setDetailedName(canonical->detailedName());
    }
}

bool HXMemoryObject::containsFakeRegion() const {
    const auto regions = memoryRegions();
    return std::any_of(regions.begin(), regions.end(), [](const HXMemoryRegion *r) { return r->isFake(); });
}

const HXMemoryRegion *HXMemoryObject::_canonicalRegion() const {
    const auto regions = memoryRegions();
    HXRequire(!regions.empty(), "HXMemoryObject _canonicalRegion", "the object has a region");
    const HXMemoryRegion *first = regions.front();
    if (!first->inSharedCache() && _ownerPid == kNoOwner) return first;
    const auto found = std::find_if(regions.begin(), regions.end(), [&](const HXMemoryRegion *region) {
        return first->inSharedCache() ? !region->unusedSharedCacheRegion() : !region->isFake();
    });
    return found == regions.end() ? first : *found;
}

std::unique_ptr<HXMemoryObject> HXMemoryObject::copy() const {
    HXRequire(_accurateSizes, "HXMemoryObject copy", "_accurateSizes");
    auto copied = std::make_unique<HXMemoryObject>();
    copied->_totalDirtySize = _totalDirtySize;
    copied->_totalCleanSize = _totalCleanSize;
    copied->_totalSwappedSize = _totalSwappedSize;
    copied->_totalReclaimableSize = _totalReclaimableSize;
    copied->_totalWiredSize = _totalWiredSize;
    copied->_memoryRegions.borrow(_memoryRegions);
    copied->_ownerPid = _ownerPid;
    copied->_index = _index;
    copied->_accurateSizes = true;
    return copied;
}

std::span<const HXMemoryObject::ProcessRegion> HXMemoryObject::regionsOfProcess(int32_t pid) const {
    const auto all = processMemoryRegions();
    const auto range =
        std::equal_range(all.begin(), all.end(), ProcessRegion{pid, nullptr},
                         [](const ProcessRegion &a, const ProcessRegion &b) { return a.pid < b.pid; });
    return {range.first, range.second};
}

// Each region enters as one whole run: the page runs are gone by now.
std::unique_ptr<HXMemoryObject> HXMemoryObject::viewOfRegions(std::span<const ProcessRegion> regions,
                                                              const HXRegionOwner &process) const {
    auto view = std::make_unique<HXMemoryObject>();
    view->_ownerPid = _ownerPid;
    view->_index = _index;
    for (const ProcessRegion &entry : regions)
        view->addRegion(*entry.region, process.pageSize());
    view->finalizeUsingRegionDirtySize(process.breakDownPhysHeft());
    return view;
}

// The charge of the whole object is its owner's: to others its dirty and swapped bytes are clean.
void HXMemoryObject::showAsClean(const HXMemoryObject &whole) {
    _totalDirtySize = 0;
    _totalSwappedSize = 0;
    _totalCleanSize += whole._totalDirtySize + whole._totalSwappedSize;
}

HXMemoryObject::View HXMemoryObject::viewForProcess(const HXRegionOwner &process) const {
    const View itself(std::shared_ptr<void>(), this); // not owned
    std::unique_ptr<HXMemoryObject> view;
    if (_processMemoryRegions) {
        const auto regions = regionsOfProcess(process.pid());
        if (regions.empty()) return itself;
        view = viewOfRegions(regions, process);
    }
    if (_ownerPid != kNoOwner && _ownerPid != process.pid()) {
        if (!view) view = copy();
        view->showAsClean(*this);
    }
    return view ? View(std::move(view)) : itself;
}
