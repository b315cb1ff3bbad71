// Each process's heft, categories and orders.
#include "analysis/HXHeft.h"

#include <algorithm>
#include <unordered_set>

uint64_t HXHeft::_calculateHeftForProcess(const HXProcess &process) const {
    uint64_t heft = 0;
    if (breakDownPhysHeft()) {
        for (const HXMemoryRegion &region : process.memoryRegions())
            heft += region.sizes().heft();
        return heft;
    }
    // Whole objects, each once.
    std::unordered_set<const HXMemoryObject *> counted;
    counted.reserve(process.memoryRegions().size());
    for (const HXMemoryRegion &region : process.memoryRegions()) {
        const HXMemoryObject *object = region.memoryObject();
        if (object && counted.insert(object).second) heft += object->sizes().heft();
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
    HXCategoryMap categories(summarize);
    bool anyView = false;
    for (const HXMemoryObject *object : objects) {
        const HXMemoryObjectView view = object->viewForProcess(viewedBy);
        anyView = anyView || !view.isWhole;
        categories.categoryForObject(*object).addMemoryObject(view);
    }
    if (hasProcessView) *hasProcessView = anyView;
    return categories;
}

HXCategoryMap HXHeft::_categoriesForAllProcessesShouldSummarize(bool summarize) const {
    HXCategoryMap categories(summarize);
    std::vector<bool> counted(_objects.size());
    for (const HXProcess *process : _notHiddenProcesses()) {
        for (const HXMemoryRegion &region : process->memoryRegions()) {
            const HXMemoryObject &object = *region.memoryObject();
            if (counted[object.index()]) continue;
            counted[object.index()] = true;
            categories.categoryForObject(object).addMemoryObject(object.wholeView());
        }
    }
    return categories;
}

HXMemoryTotal HXHeft::_totalForCategories(const HXCategoryMap &categories) {
    HXMemoryTotal total;
    for (const HXMemoryCategory &category : categories.categories())
        total += category.total();
    return total;
}
