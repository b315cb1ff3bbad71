#include "model/HXMemoryObject.h"

#include "model/HXHeftSwitches.h"
#include "model/HXRegionOwner.h"

#include <algorithm>

namespace {

using ProcessRegion = HXMemoryObject::ProcessRegion;

bool byPid(const ProcessRegion &a, const ProcessRegion &b) {
    return a.pid < b.pid;
}

// The regions' own amounts, added up.
HXSizes sumOfRegions(std::span<const ProcessRegion> regions) {
    HXSizes sum;
    for (const auto &[pid, region] : regions)
        sum += region->sizes();
    return sum;
}

// Each region enters as one whole run: the page runs are gone by now.
HXSizes sizesOfView(std::span<const ProcessRegion> regions, const HXRegionOwner &process) {
    if (regions.size() == 1) return regions.front().region->sizes();
    if (regions.front().region->isPart()) return sumOfRegions(regions);
    HXRangeList runs;
    for (const auto &[pid, region] : regions)
        runs.addRegion(*region, process.pageSize());
    HXSizes sizes = runs.sum();
    if (process.breakDownPhysHeft()) {
        const HXSizes charged = sumOfRegions(regions);
        sizes.dirty = charged.dirty;
        sizes.swapped = charged.swapped;
    }
    return sizes;
}

} // namespace

void HXRegionSet::add(HXMemoryRegion *region) {
    if (!_first) {
        _first = region;
        return;
    }
    if (!_all) _all = std::make_unique<std::vector<HXMemoryRegion *>>(1, _first);
    _all->push_back(region);
}

std::span<HXMemoryRegion *const> HXRegionSet::regions() const {
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
}

void HXMemoryObject::addRuns(HXMemoryRegion &region, uint32_t pageSize) {
    if (region.isPart()) {
        _sizes += region.countedSizes();
        return;
    }
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
    region.freeSubrangeList();
}

HXSizes HXMemoryObject::sumOfRuns() const {
    if (_rangeList) return _rangeList->sum();
    return _onlyRun ? _onlyRun->sizes() : HXSizes{};
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

// An object of parts has no other regions.
bool HXMemoryObject::isMadeOfParts() const {
    return !memoryRegions().empty() && memoryRegions().front()->isPart();
}

// With the kernel's charge for each region, an object holds at least what any one process is charged for it.
// So does one of pages that all its processes share.
void HXMemoryObject::raiseToLargestProcess() {
    forEachProcess([this](std::span<const ProcessRegion> regions) {
        const HXSizes charged = sumOfRegions(regions);
        _sizes.dirty = std::max(_sizes.dirty, charged.dirty);
        _sizes.swapped = std::max(_sizes.swapped, charged.swapped);
    });
}

bool HXMemoryObject::processRegionsTellMore() const {
    size_t processes = 0;
    bool anyDiffers = false;
    forEachProcess([&](std::span<const ProcessRegion> regions) {
        processes++;
        anyDiffers = anyDiffers || regions.size() > 1 || regions.front().region->sizes() != _sizes;
    });
    return processes >= 2 && anyDiffers;
}

void HXMemoryObject::finalize() {
    HXRequire(!_accurateSizes, "HXMemoryObject finalize", "!_accurateSizes");
    _sizes += sumOfRuns();
    if (_processMemoryRegions) {
        std::stable_sort(_processMemoryRegions->begin(), _processMemoryRegions->end(), byPid);
        if (isMadeOfParts() || HXHeftSwitches::breakDownPhysHeft()) raiseToLargestProcess();
        if (!processRegionsTellMore()) _processMemoryRegions.reset();
    }
    _rangeList.reset();
    _onlyRun = nullptr;
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

std::span<const HXMemoryObject::ProcessRegion> HXMemoryObject::regionsOfProcess(int32_t pid) const {
    const auto all = processMemoryRegions();
    const auto range = std::equal_range(all.begin(), all.end(), ProcessRegion{pid, nullptr}, byPid);
    return {range.first, range.second};
}

HXMemoryObjectView HXMemoryObject::wholeView() const {
    HXRequire(_accurateSizes, "HXMemoryObject view", "_accurateSizes");
    return {{_sizes, static_cast<uint32_t>(memoryRegions().size())}};
}

HXMemoryObjectView HXMemoryObject::viewForProcess(const HXRegionOwner &process) const {
    HXMemoryObjectView view = wholeView();
    if (_processMemoryRegions) {
        const auto regions = regionsOfProcess(process.pid());
        if (regions.empty()) return view;
        view = {{sizesOfView(regions, process), static_cast<uint32_t>(regions.size())}, false};
    }
    if (_ownerPid != kNoOwner && _ownerPid != process.pid()) {
        // The charge of the whole object is its owner's: to others its dirty and swapped bytes are clean.
        view.clean += _sizes.heft();
        view.dirty = 0;
        view.swapped = 0;
        view.isWhole = false;
    }
    return view;
}
