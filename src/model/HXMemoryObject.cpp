#include "model/HXMemoryObject.h"

#include "model/HXHeftSwitches.h"
#include "model/HXRegionOwner.h"

#include <algorithm>
#include <bit>
#include <utility>

namespace {

using ProcessRegion = HXMemoryObject::ProcessRegion;

bool canDifferByProcess(const HXMemoryRegion &region) {
    return region.object_id() != 0 && region.eligibleForProcessView();
}

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

HXSizes HXMemoryObject::sizes() const {
    if (_hasSizesOfFirst) return _first->sizes();
    return _more ? _more->sizes : HXSizes{};
}

std::span<HXMemoryRegion *const> HXMemoryObject::memoryRegions() const {
    if (_more && !_more->regions.empty()) return _more->regions;
    return {&_first, _first ? 1U : 0U};
}

std::span<const HXMemoryObject::ProcessRegion> HXMemoryObject::processMemoryRegions() const {
    if (!_more) return {};
    return _more->processMemoryRegions;
}

void HXMemoryObject::addRegion(HXMemoryRegion &region, const HXRegionOwner &process) {
    _addRegion(region, process.pageSize(), &process);
}

void HXMemoryObject::addRegion(HXMemoryRegion &region, uint32_t pageSize) {
    _addRegion(region, pageSize, nullptr);
}

void HXMemoryObject::_addRegion(HXMemoryRegion &region, uint32_t pageSize, const HXRegionOwner *process) {
    HXRequire(!_accurateSizes, "HXMemoryObject addRegion", "!_accurateSizes");
    addToRegions(region, process);
    if (region.object_id() == 0) return; // remembered, but without a share in the sizes
    addRuns(region, pageSize);
}

void HXMemoryObject::addToRegions(HXMemoryRegion &region, const HXRegionOwner *process) {
    _containsFakeRegion = _containsFakeRegion || region.isFake();
    if (!_first) {
        _first = &region;
        _isFirstByProcess = process && canDifferByProcess(region);
        if (process) _firstPid = process->pid();
        return;
    }
    auto &regions = more().regions;
    auto &byProcess = _more->processMemoryRegions;
    if (regions.empty()) {
        regions.push_back(_first);
        if (_isFirstByProcess) byProcess.push_back({_firstPid, _first});
    }
    regions.push_back(&region);
    if (process && (canDifferByProcess(region) || (!byProcess.empty() && region.object_id() != 0)))
        byProcess.push_back({process->pid(), &region});
}

void HXMemoryObject::addRuns(HXMemoryRegion &region, uint32_t pageSize) {
    if (region.isPart()) {
        more().sizes += region.countedSizes();
        return;
    }
    if (_runPageWidth == 0) {
        _runPageWidth = static_cast<uint8_t>(std::bit_width(pageSize));
        if (auto runs = region.takeSubrangeList())
            more().rangeList = std::move(runs);
        else if (&region != _first)
            more().onlyRun = &region;
        return;
    }
    auto &runs = more().rangeList;
    if (!runs) {
        runs = std::make_unique<HXRangeList>();
        runs->addRegion(*onlyRun(), uint32_t{1} << (_runPageWidth - 1));
    }
    runs->addRegion(region, pageSize);
    region.freeSubrangeList();
}

// The region that would be the only run of a range list, while there is none and any run.
const HXMemoryRegion *HXMemoryObject::onlyRun() const {
    return _more && _more->onlyRun ? _more->onlyRun : _first;
}

HXSizes HXMemoryObject::sumOfRuns() const {
    if (_more && _more->rangeList) return _more->rangeList->sum();
    return _runPageWidth != 0 ? onlyRun()->sizes() : HXSizes{};
}

// Calls `each` with the regions of every process; `all` is sorted by pid.
template <typename Each>
void HXMemoryObject::forEachProcess(std::span<const ProcessRegion> all, Each each) {
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
void HXMemoryObject::raiseToLargestProcess(std::span<const ProcessRegion> all, HXSizes *sizes) const {
    if (!isMadeOfParts() && !HXHeftSwitches::breakDownPhysHeft()) return;
    forEachProcess(all, [&](std::span<const ProcessRegion> regions) {
        const HXSizes charged = sumOfRegions(regions);
        sizes->dirty = std::max(sizes->dirty, charged.dirty);
        sizes->swapped = std::max(sizes->swapped, charged.swapped);
    });
}

bool HXMemoryObject::processRegionsTellMore(const HXSizes &sizes) const {
    size_t processes = 0;
    bool anyDiffers = false;
    forEachProcess(processMemoryRegions(), [&](std::span<const ProcessRegion> regions) {
        processes++;
        anyDiffers = anyDiffers || regions.size() > 1 || regions.front().region->sizes() != sizes;
    });
    return processes >= 2 && anyDiffers;
}

void HXMemoryObject::finalize() {
    HXRequire(!_accurateSizes, "HXMemoryObject finalize", "!_accurateSizes");
    HXSizes sizes = this->sizes();
    sizes += sumOfRuns();
    if (memoryRegions().size() > 1) {
        auto &byProcess = _more->processMemoryRegions;
        std::stable_sort(byProcess.begin(), byProcess.end(), byPid);
        raiseToLargestProcess(byProcess, &sizes);
        if (!processRegionsTellMore(sizes))
            byProcess = std::vector<ProcessRegion>(); // and gives the memory back
        _more->rangeList.reset();
        _more->sizes = sizes;
    } else {
        const ProcessRegion only = {_firstPid, _first};
        if (_isFirstByProcess) raiseToLargestProcess({&only, 1}, &sizes);
        _more.reset();
        _hasSizesOfFirst = _first && sizes == _first->sizes();
        if (!_hasSizesOfFirst && sizes != HXSizes{}) more().sizes = sizes;
    }
    if (_containsFakeRegion) nameFakeRegions();
    _accurateSizes = true;
}

// Unmapped owned memory is named after the object's mapped regions.
void HXMemoryObject::nameFakeRegions() {
    const HXMemoryRegion *canonical = _canonicalRegion();
    if (canonical->isFake()) return;
    for (HXMemoryRegion *region : memoryRegions()) {
        if (!region->isFake()) continue;
        region->setName(canonical->name());
        region->setDetailedName(canonical->detailedName());
    }
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
    return {{sizes(), static_cast<uint32_t>(memoryRegions().size())}};
}

HXMemoryObjectView HXMemoryObject::viewForProcess(const HXRegionOwner &process) const {
    HXMemoryObjectView view = wholeView();
    if (!processMemoryRegions().empty()) {
        const auto regions = regionsOfProcess(process.pid());
        if (regions.empty()) return view;
        view = {{sizesOfView(regions, process), static_cast<uint32_t>(regions.size())}, false};
    }
    if (_ownerPid != kNoOwner && _ownerPid != process.pid()) {
        // The charge of the whole object is its owner's: to others its dirty and swapped bytes are clean.
        view.clean += sizes().heft();
        view.dirty = 0;
        view.swapped = 0;
        view.isWhole = false;
    }
    return view;
}
