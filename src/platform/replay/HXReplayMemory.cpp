// HXReplayPlatform: tasks and virtual memory.
#include "platform/replay/HXReplayPlatform.h"

#include "platform/HXRegionTags.h"
#include "platform/HXSafeText.h"
#include "platform/capture/HXRegionFields.h"

#include <algorithm>
#include <cstring>
#include <iterator>

namespace {

constexpr mach_port_t kTaskSelf = 1;
constexpr mach_port_t kHostSelf = 2;
constexpr mach_port_t kFirstTask = 16; // the task of the first process

// The first of mappings in ascending order whose end lies above `address`, from the one at `hint` on when it
// can be.
template <class Mappings>
size_t firstEndingAbove(const Mappings &mappings, uint64_t address, size_t hint) {
    const auto isFirst = [&](size_t i) {
        return (i == mappings.size() || mappings[i].end() > address) &&
               (i == 0 || mappings[i - 1].end() <= address);
    };
    for (size_t i = hint; i < hint + 2 && i <= mappings.size(); i++)
        if (isFirst(i)) return i;
    const auto found =
        std::upper_bound(mappings.begin(), mappings.end(), address,
                         [](uint64_t wanted, const auto &mapping) { return wanted < mapping.end(); });
    return static_cast<size_t>(found - mappings.begin());
}

} // namespace

HXReplayPlatform::HXReplayPlatform(const HXMachine &machine, HXServices &services)
    : _machine(machine), _services(services), _states(machine.processes.size()),
      _selfRegionHeft(machine.host.selfRegionHeft.value_or(0)) {
    mapNamedTags();
}

HXReplayPlatform::~HXReplayPlatform() = default;

mach_port_t HXReplayPlatform::mach_task_self() {
    return kTaskSelf;
}

mach_port_t HXReplayPlatform::mach_host_self() {
    return kHostSelf;
}

kern_return_t HXReplayPlatform::task_for_pid(mach_port_t, int32_t pid, mach_port_t *task) {
    const auto found = _machine.processIndices.find(pid);
    if (found == _machine.processIndices.end()) return KERN_FAILURE;
    const kern_return_t error = _machine.processes[found->second].taskError;
    if (error == KERN_SUCCESS) *task = kFirstTask + found->second;
    return error;
}

void HXReplayPlatform::mach_port_deallocate(mach_port_t, mach_port_t) {}

HXReplayPlatform::Task HXReplayPlatform::taskOf(mach_port_t task) {
    const size_t index = size_t{task} - kFirstTask;
    if (task < kFirstTask || index >= _machine.processes.size()) return {};
    return {&_machine.processes[index], &_states[index]};
}

HXReplayPlatform::State *HXReplayPlatform::stateOf(int32_t pid) {
    const auto found = _machine.processIndices.find(pid);
    return found == _machine.processIndices.end() ? nullptr : &_states[found->second];
}

// Counts a call; the error of the fault that it meets, or KERN_SUCCESS.
kern_return_t HXReplayPlatform::countCall(const HXMachineProcess &process, State &state, HXMachineCall call) {
    if (!process.faults) return KERN_SUCCESS;
    const HXMachineFault &fault = process.faults->ofCall[static_cast<size_t>(call)];
    if (fault.error == 0 || ++state.calls[static_cast<size_t>(call)] < fault.from) return KERN_SUCCESS;
    if (fault.becomes != HXMachineFate::alive) state.fate = fault.becomes;
    return fault.error;
}

bool HXReplayPlatform::exists(const HXMachineRegion &region) const {
    return countsHeft() || !_machine.traits(region).heftOnly;
}

// The first region that ends above `address`; null when there is none.
const HXMachineRegion *HXReplayPlatform::firstRegion(const HXMachineProcess &process, State &state,
                                                     uint64_t address) const {
    if (!process.regions) return nullptr;
    const auto &regions = *process.regions;
    size_t i = firstEndingAbove(regions, address, state.walkHint.load(std::memory_order_relaxed));
    state.walkHint.store(i, std::memory_order_relaxed);
    while (i < regions.size() && !exists(regions[i]))
        i++;
    return i < regions.size() ? &regions[i] : nullptr;
}

// The region that holds `address`; null when none does.
const HXMachineRegion *HXReplayPlatform::regionAt(const HXMachineProcess &process, State &state,
                                                  uint64_t address) const {
    const HXMachineRegion *const region = firstRegion(process, state, address);
    return region != nullptr && region->address <= address ? region : nullptr;
}

uint64_t HXReplayPlatform::pageTableObject(mach_port_t task) {
    const HXMachineProcess *const process = taskOf(task).process;
    return process ? process->pageTableObject : UINT64_MAX;
}

namespace {

std::vector<task_held_object> heldBy(const HXMachineProcess *process, bool isOpen) {
    std::vector<task_held_object> held;
    if (process == nullptr) return held;
    std::copy_if(process->held.begin(), process->held.end(), std::back_inserter(held),
                 [isOpen](const task_held_object &object) {
                     return ((object.flags & TASK_HELD_OPEN) != 0) == isOpen;
                 });
    return held;
}

} // namespace

std::vector<task_held_object> HXReplayPlatform::task_held_objects(mach_port_t task) {
    return heldBy(taskOf(task).process, false);
}

std::vector<task_held_object> HXReplayPlatform::proc_held_objects(int32_t pid) {
    const HXMachineProcess *const process = _machine.process(pid);
    return heldBy(process && process->taskError == KERN_SUCCESS ? process : nullptr, true);
}

std::vector<task_held_object> HXReplayPlatform::host_held_objects(mach_port_t) {
    const HXMachineProcess *const kernel = _machine.process(0);
    return kernel == nullptr ? std::vector<task_held_object>() : kernel->held;
}

kern_return_t HXReplayPlatform::mach_vm_region(mach_port_t task, uint64_t *address, uint64_t *size,
                                               int32_t flavor, vm_region_basic_info_64 *info,
                                               uint32_t *infoCount) {
    const auto [process, state] = taskOf(task);
    if (process == nullptr) return MACH_SEND_INVALID_DEST;
    if (const kern_return_t error = countCall(*process, *state, HXMachineCall::region)) return error;
    if (flavor != VM_REGION_BASIC_INFO_64 || *infoCount < VM_REGION_BASIC_INFO_COUNT_64)
        return KERN_INVALID_ARGUMENT;
    if (!process->tops.empty()) {
        const size_t i = firstEndingAbove(process->tops, *address, process->tops.size());
        if (i == process->tops.size()) return KERN_INVALID_ADDRESS;
        *address = process->tops[i].address;
        *size = process->tops[i].size;
        *info = process->tops[i].info;
    } else {
        const HXMachineRegion *const region = firstRegion(*process, *state, *address);
        if (region == nullptr) return KERN_INVALID_ADDRESS;
        *address = region->address;
        *size = region->size;
        *info = HXBasicInfo(_machine.info(*region));
    }
    *infoCount = VM_REGION_BASIC_INFO_COUNT_64;
    return KERN_SUCCESS;
}

vm_region_submap_info_64 HXReplayPlatform::info(const HXMachineRegion &region) const {
    vm_region_submap_info_64 info = _machine.info(region);
    info.user_tag = hostTag(info);
    if (!countsHeft()) info.pages_dirtied = region.dirtiedObjectPages;
    return info;
}

kern_return_t HXReplayPlatform::mach_vm_region_recurse(mach_port_t task, uint64_t *address, uint64_t *size,
                                                       uint32_t *nestingDepth, vm_region_submap_info_64 *info,
                                                       uint32_t *infoCount) {
    const auto [process, state] = taskOf(task);
    if (process == nullptr) return MACH_SEND_INVALID_DEST;
    if (const kern_return_t error = countCall(*process, *state, HXMachineCall::regionRecurse)) return error;
    const HXMachineRegion *const region = firstRegion(*process, *state, *address);
    if (region == nullptr) return KERN_INVALID_ADDRESS;
    const vm_region_submap_info_64 filled = this->info(*region);
    const uint32_t words = _machine.traits(*region).shortRecord ? VM_REGION_SUBMAP_INFO_V1_COUNT_64
                                                                : VM_REGION_SUBMAP_INFO_COUNT_64;
    *nestingDepth = 0; // regions are leaves
    *infoCount = std::min(*infoCount, words);
    std::memcpy(static_cast<void *>(info), &filled, *infoCount * sizeof(uint32_t));
    *address = region->address;
    *size = region->size;
    return KERN_SUCCESS;
}

// How many calls more succeed before the fault is met; each kPageQueryPages begun are one.
uint64_t HXReplayPlatform::callsBeforeFault(const HXMachineProcess &process, const State &state,
                                            HXMachineCall call) {
    if (!process.faults) return UINT64_MAX;
    const HXMachineFault &fault = process.faults->ofCall[static_cast<size_t>(call)];
    const uint64_t calls = state.calls[static_cast<size_t>(call)] + 1;
    if (fault.error == 0) return UINT64_MAX;
    return fault.from > calls ? fault.from - calls : 0;
}

kern_return_t HXReplayPlatform::mach_vm_page_range_query(mach_port_t task, uint64_t address, uint64_t size,
                                                         std::vector<vm_page_run> *runs, uint64_t *pages) {
    const auto [process, state] = taskOf(task);
    if (process == nullptr) return KERN_INVALID_ARGUMENT;
    constexpr HXMachineCall call = HXMachineCall::pageRangeQuery;
    const uint64_t moreCalls = callsBeforeFault(*process, *state, call);
    if (const kern_return_t error = countCall(*process, *state, call)) return error;
    const uint64_t pageSize = _machine.host.pageSize;
    const uint64_t inPage = address % pageSize, start = address - inPage;
    const uint64_t asked = size / pageSize + (size % pageSize + inPage + pageSize - 1) / pageSize;
    const uint64_t told =
        moreCalls > asked / kPageQueryPages ? asked : std::min(asked, moreCalls * kPageQueryPages);
    runs->clear();
    const uint64_t found = findRuns(*process, *state, start / pageSize, told, runs);
    *pages = told;
    if (found < told) {
        *pages = found / kPageQueryPages * kPageQueryPages;
        if (*pages == 0) return KERN_INVALID_ADDRESS;
        HXCutRuns(start + *pages * pageSize, pageSize, runs);
    }
    state->calls[static_cast<size_t>(call)] += *pages == 0 ? 0 : (*pages - 1) / kPageQueryPages;
    return KERN_SUCCESS;
}

// Adds the runs of `pages` pages from number `first` on; how many lie in regions with known pages, up to the
// first one that does not.
uint64_t HXReplayPlatform::findRuns(const HXMachineProcess &process, State &state, uint64_t first,
                                    uint64_t pages, std::vector<vm_page_run> *runs) const {
    const uint64_t pageSize = _machine.host.pageSize;
    uint64_t found = 0;
    while (found < pages && first + found <= UINT64_MAX / pageSize) {
        const HXMachineRegion *const region = regionAt(process, state, (first + found) * pageSize);
        if (region == nullptr || !_machine.extra(*region).hasPageRuns) break;
        const uint64_t index = first + found - region->address / pageSize;
        const uint64_t count = std::min(region->size / pageSize - index, pages - found);
        addRuns(*region, index, index + count, runs);
        found += count;
    }
    return found;
}

// Adds the runs of a region's pages from `index` to the one before `endIndex`.
void HXReplayPlatform::addRuns(const HXMachineRegion &region, uint64_t index, uint64_t endIndex,
                               std::vector<vm_page_run> *runs) const {
    const uint64_t pageSize = _machine.host.pageSize;
    const HXMachineRegionExtra &extra = _machine.extra(region);
    const auto first = _machine.pageRuns.begin() + static_cast<std::ptrdiff_t>(extra.firstPageRun);
    const auto last = first + extra.pageRunCount;
    auto run = std::upper_bound(first, last, index, [](uint64_t wanted, const HXMachinePageRun &each) {
        return wanted < each.endPage;
    });
    for (; run != last && index < endIndex; ++run) {
        const uint64_t end = std::min<uint64_t>(run->endPage, endIndex);
        if (run->disposition != 0)
            runs->push_back({region.address + index * pageSize, end - index, run->disposition});
        index = end;
    }
}

std::vector<vm_region_share> HXReplayPlatform::mach_vm_region_shares(mach_port_t task, uint64_t address) {
    const auto [process, state] = taskOf(task);
    const HXMachineRegion *const region = process ? regionAt(*process, *state, address) : nullptr;
    if (region == nullptr) return {};
    const HXMachineRegionExtra &extra = _machine.extra(*region);
    const auto first = _machine.shares.begin() + static_cast<std::ptrdiff_t>(extra.firstShare);
    return {first, first + extra.shareCount};
}

kern_return_t HXReplayPlatform::mach_vm_purgable_control(mach_port_t task, uint64_t address, int32_t control,
                                                         int32_t *purgeState) {
    const auto [process, state] = taskOf(task);
    if (process == nullptr || control != VM_PURGABLE_GET_STATE) return KERN_INVALID_ARGUMENT;
    const HXMachineRegion *const region = regionAt(*process, *state, address);
    if (region == nullptr) return KERN_INVALID_ADDRESS;
    const std::optional<int32_t> &purge = _machine.traits(*region).purge;
    if (!purge) return KERN_INVALID_ARGUMENT;
    *purgeState = *purge;
    return KERN_SUCCESS;
}

int32_t HXReplayPlatform::proc_regionfilename(int32_t pid, uint64_t address, char *buffer,
                                              uint32_t bufferBytes) {
    const HXMachineProcess *const process = _machine.process(pid);
    if (process == nullptr) return 0;
    const HXMachineRegion *const region = regionAt(*process, *stateOf(pid), address);
    if (region == nullptr) return 0;
    const std::string_view path = HXCutText(text(region->path), bufferBytes);
    std::copy(path.begin(), path.end(), buffer);
    return static_cast<int32_t>(path.size());
}

// The machine's names for tags that programs name get the tags that this run has for those names.
void HXReplayPlatform::mapNamedTags() {
    for (const auto &[tag, name] : _machine.tagNames) {
        if (tag < HXHostTagFirstNamed || tag > HXHostTagLastNamed) continue;
        const std::optional<uint32_t> own = namedTags().tagForName(name);
        _namedTags[tag] = own.value_or(HXHostTagAnonymous);
    }
}

uint32_t HXReplayPlatform::hostTag(const vm_region_submap_info_64 &info) const {
    const auto found = _namedTags.find(info.user_tag);
    if (found == _namedTags.end()) return info.user_tag;
    // As on a live host, names that find no free tag are lost.
    const bool unnamed = found->second == HXHostTagAnonymous;
    return unnamed && info.share_mode == SM_SHARED ? HXHostTagSharedAnonymous : found->second;
}

std::optional<std::string>
HXReplayPlatform::GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t, int32_t, uint8_t) {
    // Memory graphs that are read beside the machine may have brought names of their own.
    if (auto name = namedTags().nameForTag(tag)) return name;
    const auto found = _machine.tagNames.find(tag);
    if (found == _machine.tagNames.end()) return std::nullopt;
    return found->second;
}
