// Tasks, their mappings, their pages and their images.
#include "platform/linux/HXLinuxPlatform.h"

#include "platform/HXSafeText.h"
#include "platform/linux/images/HXImageLayout.h"
#include "platform/linux/procfs/HXProcFile.h"
#include "platform/linux/procfs/HXTaskFiles.h"
#include "platform/linux/sharing/HXSharing.h"

#include <fcntl.h>
#include <sys/resource.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

namespace {

class TaskSymbolicator final : public RVSymbolicator {
  public:
    std::vector<HXLoadedImage> images;
};

// Whether one more task may keep two descriptors: half of them are for reading.
bool maySpareDescriptors(size_t taskCount) {
    constexpr rlim_t share = 4;
    rlimit limit;
    return ::getrlimit(RLIMIT_NOFILE, &limit) == 0 && taskCount < limit.rlim_cur / share;
}

kern_return_t errorOfOpening(int error) {
    if (HXShortageWatch::isShortage(error)) return KERN_RESOURCE_SHORTAGE;
    return error == EACCES || error == EPERM ? KERN_NO_ACCESS : KERN_FAILURE;
}

} // namespace

// Looks at no mapping: that could wait for another thread of the process as long as that likes.
kern_return_t HXLinuxPlatform::task_for_pid(mach_port_t, int32_t pid, mach_port_t *task) {
    std::unique_ptr<HXLinuxTask> opened;
    kern_return_t error = openTask(pid, true, &opened);
    // It may have ended since it was listed, or its leading thread alone.
    if (error == KERN_FAILURE || (opened && opened->residentSizeWhenOpened() == 0))
        error = openTask(pid, false, &opened);
    if (error == KERN_SUCCESS) *task = _tasks.add(std::move(opened));
    return error;
}

kern_return_t HXLinuxPlatform::openTask(int32_t pid, bool asListed, std::unique_ptr<HXLinuxTask> *task) {
    if (pid <= 0) return KERN_FAILURE;
    auto process = _processes.open(pid, asListed);
    if (!process) return errorOfOpening(errno);
    if (process->stat.hasEnded() || process->stat.isKernelThread()) return KERN_FAILURE;
    HXDescriptor maps = HXOpenAt(process->directory, "maps");
    if (!maps) return errorOfOpening(errno);
    *task = std::make_unique<HXLinuxTask>(pid, _identifiers.numberOfProcess(pid), std::move(*process),
                                          std::move(maps), maySpareDescriptors(_tasks.count()), _processes,
                                          _turns);
    return KERN_SUCCESS;
}

uint64_t HXLinuxPlatform::expectedCost(int32_t pid) {
    if (pid == 0) return UINT64_MAX;
    const HXLinuxTask *task = _tasks.findByPid(pid);
    return task == nullptr ? 0 : task->residentSizeWhenOpened();
}

void HXLinuxPlatform::mach_port_deallocate(mach_port_t, mach_port_t task) {
    _tasks.remove(task);
}

const HXAddressSpace &HXLinuxPlatform::addressSpaceOf(HXLinuxTask *task) {
    return task->addressSpace(_readerSetting, _reportsCharge.load(std::memory_order_relaxed) == 0);
}

const HXMapping *HXLinuxPlatform::mappingAt(HXLinuxTask *task, uint64_t *address, uint64_t *size,
                                            kern_return_t *error) {
    if (task == nullptr) {
        *error = MACH_SEND_INVALID_DEST;
        return nullptr;
    }
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    const size_t index = task->find(*address);
    if (index == addressSpace.count()) {
        *error = addressSpace.endError;
        return nullptr;
    }
    const HXMapping &mapping = addressSpace[index];
    *address = mapping.start;
    *size = mapping.end - mapping.start;
    *error = KERN_SUCCESS;
    return &mapping;
}

vm_region_submap_info_64 HXLinuxPlatform::infoOf(HXLinuxTask *task, const HXMapping &mapping) {
    // Not read anew, whatever the setting is by now: the mapping lies in it.
    const HXMappingOwner owner{task->pid(), task->number(), task->addressSpace().ipcNamespace};
    return HXRegionInfo(mapping, _identifiers.of(mapping, owner),
                        _reportsCharge.load(std::memory_order_relaxed) != 0);
}

kern_return_t HXLinuxPlatform::mach_vm_region(mach_port_t port, uint64_t *address, uint64_t *size,
                                              int32_t flavor, vm_region_basic_info_64 *info,
                                              uint32_t *infoCount) {
    if (flavor != VM_REGION_BASIC_INFO_64 || *infoCount < VM_REGION_BASIC_INFO_COUNT_64)
        return KERN_INVALID_ARGUMENT;
    HXLinuxTask *task = _tasks.find(port);
    kern_return_t error = KERN_SUCCESS;
    const HXMapping *mapping = mappingAt(task, address, size, &error);
    if (mapping == nullptr) return error;
    const vm_region_submap_info_64 full = infoOf(task, *mapping);
    *info = {};
    info->protection = full.protection;
    info->max_protection = full.max_protection;
    info->inheritance = full.inheritance;
    info->shared = mapping->has(HXMappingShared);
    info->offset = full.offset;
    info->behavior = full.behavior;
    info->user_wired_count = full.user_wired_count;
    *infoCount = VM_REGION_BASIC_INFO_COUNT_64;
    return KERN_SUCCESS;
}

kern_return_t HXLinuxPlatform::mach_vm_region_recurse(mach_port_t port, uint64_t *address, uint64_t *size,
                                                      uint32_t *nestingDepth, vm_region_submap_info_64 *info,
                                                      uint32_t *infoCount) {
    HXLinuxTask *task = _tasks.find(port);
    kern_return_t error = KERN_SUCCESS;
    const HXMapping *mapping = mappingAt(task, address, size, &error);
    if (mapping == nullptr) return error;
    const vm_region_submap_info_64 full = infoOf(task, *mapping);
    *infoCount = std::min(*infoCount, VM_REGION_SUBMAP_INFO_COUNT_64);
    std::memcpy(static_cast<void *>(info), &full, *infoCount * sizeof(uint32_t));
    *nestingDepth = 0; // there are no submaps
    return KERN_SUCCESS;
}

kern_return_t HXLinuxPlatform::mach_vm_page_range_query(mach_port_t port, uint64_t address, uint64_t size,
                                                        std::vector<vm_page_run> *runs, uint64_t *pages) {
    HXLinuxTask *task = _tasks.find(port);
    if (task == nullptr) return KERN_INVALID_ARGUMENT;
    const uint64_t mask = _pageSize - 1;
    const uint64_t start = address & ~mask;
    const uint64_t inLastPages = (size & mask) + (address - start) + mask;
    // No mapping reaches into the last page of all.
    const uint64_t mostPages = (UINT64_MAX - start) / _pageSize;
    *pages = std::min(size / _pageSize + inLastPages / _pageSize, mostPages);
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    if (*pages == 0 && size > 0) return KERN_INVALID_ADDRESS;
    const uint64_t asked = *pages;
    kern_return_t error = KERN_SUCCESS;
    const bool suffice = task->withDescriptors([&] {
        *pages = asked;
        error = task->pages().query(addressSpace, start, runs, pages);
    });
    return error != KERN_SUCCESS && !suffice ? KERN_RESOURCE_SHORTAGE : error;
}

std::vector<int32_t> HXLinuxPlatform::examineTogether(const std::function<bool()> &isCancelled) {
    HXSharing sharing({&_services, &_readerSetting, &_identifiers, _sysPath,
                       _reportsCharge.load(std::memory_order_relaxed) == 0, isCancelled});
    const std::set<int32_t> unanswering = sharing.examine(_tasks.all());
    _sharedSizeNotTold = sharing.sizeNotTold();
    return {unanswering.begin(), unanswering.end()};
}

std::vector<vm_region_share> HXLinuxPlatform::mach_vm_region_shares(mach_port_t port, uint64_t address) {
    HXLinuxTask *task = _tasks.find(port);
    if (task == nullptr) return {};
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    const size_t index = task->find(address);
    if (index == addressSpace.count() || addressSpace[index].start != address) return {};
    return task->sharesOf(index);
}

std::optional<HXWalkDifference> HXLinuxPlatform::walkDifference(mach_port_t port) {
    HXLinuxTask *task = _tasks.find(port);
    if (task == nullptr) return std::nullopt;
    addressSpaceOf(task);
    return task->difference();
}

uint64_t HXLinuxPlatform::pageTableObject(mach_port_t port) {
    const HXLinuxTask *task = _tasks.find(port);
    return task == nullptr ? UINT64_MAX : _identifiers.ofPageTables(task->pid());
}

std::vector<task_held_object> HXLinuxPlatform::task_held_objects(mach_port_t port) {
    std::vector<task_held_object> held;
    HXLinuxTask *task = _tasks.find(port);
    if (task == nullptr) return held;
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    task->withDescriptors([&] { held = _held.mapped(task->directory(), addressSpace); });
    return held;
}

std::vector<task_held_object> HXLinuxPlatform::proc_held_objects(int32_t pid) {
    std::vector<task_held_object> held;
    if (pid <= 0) return held;
    (void)_turns.run([&] {
        auto found = _held.open(_processes.openDescriptors(pid));
        if (!found) { // another thread shows them where the leading one has ended
            const auto process = _processes.open(pid);
            if (process && process->stat.lacksLeader())
                found = _held.open(HXOpenAt(process->directory, "fd", O_DIRECTORY));
        }
        held = std::move(found).value_or(std::vector<task_held_object>());
    });
    return held;
}

int32_t HXLinuxPlatform::proc_regionfilename(int32_t pid, uint64_t address, char *buffer,
                                             uint32_t bufferBytes) {
    HXLinuxTask *task = _tasks.findByPid(pid);
    if (task == nullptr) {
        errno = ESRCH;
        return 0;
    }
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    const size_t index = task->find(address);
    if (index == addressSpace.count() || !addressSpace[index].contains(address) ||
        !addressSpace[index].isFile())
        return 0;
    const std::string_view path = HXCutText(addressSpace.path(addressSpace[index].path).text, bufferBytes);
    std::copy(path.begin(), path.end(), buffer);
    return static_cast<int32_t>(path.size());
}

RVSymbolicator *HXLinuxPlatform::RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t port, uint32_t,
                                                                                  const void *) {
    HXLinuxTask *task = _tasks.find(port);
    if (task == nullptr) return nullptr;
    const HXAddressSpace &addressSpace = addressSpaceOf(task);
    auto symbolicator = std::make_unique<TaskSymbolicator>();
    task->withDescriptors([&] {
        symbolicator->images = HXFindImages(addressSpace, _pageSize, [&](size_t index) {
            return _imageHeaders.headersOf(addressSpace, index, task->directory());
        });
    });
    return symbolicator.release();
}

void HXLinuxPlatform::RVSymbolicatorForeachSymbolOwnerAtTime(
    RVSymbolicator *symbolicator, uint64_t, const std::function<void(const RVSymbolOwner &)> &each) {
    const auto *task = dynamic_cast<const TaskSymbolicator *>(symbolicator);
    if (task == nullptr) return;
    for (const HXLoadedImage &image : task->images)
        each({image.path.c_str(), image.baseAddress, image.segments.data(), image.segments.size()});
}
