// Each process's heft, categories and orders.
#include "analysis/HXHeft.h"

#include <algorithm>

uint64_t HXHeft::_calculateHeftForProcess(const HXProcess &process) const {
    uint64_t heft = 0;
    if (breakDownPhysHeft()) {
        for (const HXMemoryRegion &region : process.memoryRegions())
            heft += region.dirtySize() + region.swappedSize();
        return heft;
    }
    // Whole objects, each once.
    std::unordered_set<const HXMemoryObject *> counted;
    counted.reserve(process.memoryRegions().size());
    for (const HXMemoryRegion &region : process.memoryRegions()) {
        const HXMemoryObject *object = region.memoryObject();
        if (object && counted.insert(object).second)
            heft += object->totalDirtySize() + object->totalSwappedSize();
    }
    return heft;
}

void HXHeft::_buildProcessToHeftMap() {
    _pidToHeft.clear();
    for (const HXProcess *process : _notHiddenProcesses())
        _pidToHeft[process->pid()] = _calculateHeftForProcess(*process);
}

HXHeft::Processes HXHeft::_notHiddenProcesses() const {
    Processes shown;
    for (const auto &process : _processes)
        if (!process->hiddenFromDisplay()) shown.push_back(process.get());
    return shown;
}

std::vector<HXProcess *> HXHeft::_processesBySortingPidDesc(const ProcessList &processes) {
    std::vector<HXProcess *> sorted;
    for (const auto &process : processes)
        sorted.push_back(process.get());
    std::stable_sort(sorted.begin(), sorted.end(),
                     [](const HXProcess *a, const HXProcess *b) { return a->pid() > b->pid(); });
    return sorted;
}

HXHeft::Processes HXHeft::_processesBySortingHeft(Processes processes) const {
    const auto heftOf = [this](const HXProcess *process) {
        const auto found = _pidToHeft.find(process->pid());
        return found == _pidToHeft.end() ? 0 : found->second;
    };
    std::stable_sort(processes.begin(), processes.end(), [&](const HXProcess *a, const HXProcess *b) {
        const uint64_t heftOfA = heftOf(a);
        const uint64_t heftOfB = heftOf(b);
        return heftOfA != heftOfB ? heftOfA > heftOfB : a->pid() > b->pid();
    });
    return processes;
}

HXCategoryMap HXHeft::_categoriesForObjects(const HXHeftSharingData::Objects &objects,
                                            const HXProcess &viewedBy, bool *hasProcessView,
                                            bool summarize) const {
    HXCategoryMap categories;
    bool anyView = false;
    for (const HXMemoryObject *object : objects) {
        const HXSegment segment = object->memoryRegions().front()->segment();
        HXMemoryCategory &category = categories.categoryForObject(*object, segment, summarize);
        HXMemoryObject::View view = object->viewForProcess(viewedBy);
        anyView = anyView || view.get() != object;
        category.addMemoryObject(std::move(view));
    }
    if (hasProcessView) *hasProcessView = anyView;
    return categories;
}

HXCategoryMap HXHeft::_categoriesForAllProcessesShouldSummarize(bool summarize) const {
    HXCategoryMap categories;
    std::vector<bool> counted;
    for (const HXProcess *process : _notHiddenProcesses()) {
        for (const HXMemoryRegion &region : process->memoryRegions()) {
            const HXMemoryObject *object = region.memoryObject();
            if (object->index() >= counted.size()) counted.resize(2 * size_t{object->index()} + 1);
            if (counted[object->index()]) continue;
            counted[object->index()] = true;
            HXMemoryCategory &category = categories.categoryForObject(*object, region.segment(), summarize);
            category.addMemoryObject(HXMemoryObject::View(std::shared_ptr<void>(), object));
        }
    }
    return categories;
}

void HXHeft::_totalForCategories(const HXCategoryMap &categories, HXMemoryTotal *outTotal) {
    *outTotal = {};
    for (const auto &[key, category] : categories.entries()) {
        outTotal->dirty += category->totalDirtySize();
        outTotal->swapped += category->totalSwappedSize();
        outTotal->clean += category->totalCleanSize();
        outTotal->reclaimable += category->totalReclaimableSize();
        outTotal->wired += category->totalWiredSize();
        outTotal->regionCount += static_cast<uint32_t>(category->totalRegions());
    }
}
