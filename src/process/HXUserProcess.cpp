// Construction and the walk of the address space.
#include "process/HXUserProcess.h"

#include "platform/HXPlatform.h"
#include "process/HXImageStringCache.h"

#include <algorithm>

namespace {

struct SharedRegionLayout {
    uint64_t base;
    uint64_t size;
};

// By platform code.
constexpr SharedRegionLayout sharedRegionLayouts[] = {
    {0x90000000, 0x20000000},     // 32-bit Intel
    {0x7FFF00000000, 0xFFE00000}, // 64-bit Intel
    {0x40000000, 0x40000000},     // 32-bit ARM
    {0x180000000, 0x100000000},   // 64-bit ARM
    {0x1A000000, 0x40000000},     // 64-bit ARM with 32-bit pointers
};

vm_region_submap_info_64 infoOfSharedRegionEntry(const vm_region_basic_info_64 &basic) {
    vm_region_submap_info_64 info{};
    info.protection = basic.protection;
    info.max_protection = basic.max_protection;
    info.inheritance = basic.inheritance;
    info.offset = basic.offset;
    info.behavior = basic.behavior;
    info.user_wired_count = basic.user_wired_count;
    info.external_pager = 1;
    info.share_mode = SM_COW;
    info.object_id = 1;
    info.object_id_full = 1;
    return info;
}

} // namespace

HXUserProcess::~HXUserProcess() {
    releaseTask();
}

void HXUserProcess::releaseTask() {
    HXPlatform &platform = HXPlatform::current();
    if (_task != 0) platform.mach_port_deallocate(platform.mach_task_self(), _task);
    _task = 0;
}

bool HXUserProcess::initWithBsdInfo(const proc_bsdinfo &info) {
    if (!HXProcess::initWithBsdInfo(info)) return false;
    _setSharedRegionFromPlatform(is64bit() ? HXPlatformARM64 : HXPlatformARM32);
    _images.clear();
    _gatherPhysHeft();
    _gatherLedgers();
    _gatherIdleExitStatus();
    _sharedRegionAlignmentSize = 0x1000;
    return true;
}

bool HXUserProcess::_populateTask() {
    HXPlatform &platform = HXPlatform::current();
    const kern_return_t error = platform.task_for_pid(platform.mach_task_self(), pid(), &_task);
    if (error == KERN_SUCCESS) return true;
    _task = 0;
    platform.mach_error("task_for_pid", error);
    _addGlobalError("task_for_pid [" + std::to_string(pid()) + "] " + platform.mach_error_string(error));
    return false;
}

bool HXUserProcess::_hostHasSharedRegion() const {
    return HXPlatform::current().hasSharedRegion();
}

bool HXUserProcess::_setSharedRegionFromPlatform(int32_t platform) {
    if (platform < 0 || platform >= static_cast<int32_t>(std::size(sharedRegionLayouts))) {
        std::fputs("Unable to determine platform architecture of target\n", stderr);
        return false;
    }
    const bool exists = _hostHasSharedRegion();
    _sharedRegionBase = exists ? sharedRegionLayouts[platform].base : 0;
    _sharedRegionSize = exists ? sharedRegionLayouts[platform].size : 0;
    return true;
}

void HXUserProcess::printBailingOut() const {
    std::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n", displayString().c_str());
}

void HXUserProcess::walkFailed(const char *call, kern_return_t error) {
    HXPlatform::current().mach_error(call, error);
    printBailingOut();
    _processMachVMError(error, MACH_SEND_INVALID_DEST);
}

uint64_t HXUserProcess::_lastNonSharedCacheRegion() {
    constexpr uint64_t tolerance = 0x1000000;
    HXPlatform &platform = HXPlatform::current();
    uint64_t low = 0;
    uint64_t high = _sharedRegionBase;
    while (high > low && high - low > tolerance) {
        const uint64_t middle = high / 2 + low / 2;
        uint64_t start = middle;
        uint64_t size = 0;
        vm_region_basic_info_64 info{};
        uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
        if (platform.mach_vm_region(_task, &start, &size, VM_REGION_BASIC_INFO_64, &info, &count) !=
            KERN_SUCCESS)
            break;
        if (start == low) break;
        if (start < _sharedRegionBase)
            low = start;
        else
            high = middle - pageSize();
    }
    return low;
}

void HXUserProcess::enumerateRegions(const HXRegionCallback &callback) {
    HXPlatform &platform = HXPlatform::current();
    const uint64_t last = _lastNonSharedCacheRegion();
    const uint64_t sharedRegionEnd = _sharedRegionBase + _sharedRegionSize;
    uint64_t address = 0;
    uint64_t size = 0;
    bool seenFakeRegion = false;
    for (bool stop = false; !stop; address += size) {
        if (last != 0 && address >= last && address < sharedRegionEnd) {
            const uint64_t asked = address;
            vm_region_basic_info_64 basic{};
            uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
            const kern_return_t error =
                platform.mach_vm_region(_task, &address, &size, VM_REGION_BASIC_INFO_64, &basic, &count);
            address = std::max(address, asked);
            if (error == KERN_INVALID_ADDRESS) return;
            if (error != KERN_SUCCESS) return walkFailed("mach_vm_region", error);
            if (inSharedRegion(address)) {
                stop =
                    callback(address, size, infoOfSharedRegionEntry(basic), VM_PURGABLE_DENY, std::nullopt);
                continue;
            }
        }
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX;
        uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        const kern_return_t error =
            platform.mach_vm_region_recurse(_task, &address, &size, &depth, &info, &count);
        if (error == KERN_INVALID_ADDRESS) return;
        if (error != KERN_SUCCESS) return walkFailed("mach_vm_region_recurse", error);
        if (count <= VM_REGION_SUBMAP_INFO_V1_COUNT_64) info.object_id_full = info.object_id;
        // The fake region that the kernel reports after the last mapping closes the walk.
        if (info.user_tag != kFakeRegionTag && seenFakeRegion) return;
        seenFakeRegion = seenFakeRegion || info.user_tag == kFakeRegionTag;
        handOverRegion(address, size, info, callback, &stop);
    }
}

void HXUserProcess::handOverRegion(uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                                   const HXRegionCallback &callback, bool *stop) {
    HXRequire(!info.is_submap, "HXUserProcess enumerateRegions", "a full-depth recursion ends at a leaf");
    HXPlatform &platform = HXPlatform::current();
    int32_t purgeState = VM_PURGABLE_DENY;
    if (platform.mach_vm_purgable_control(_task, address, VM_PURGABLE_GET_STATE, &purgeState) != KERN_SUCCESS)
        purgeState = VM_PURGABLE_DENY;
    char buffer[1025];
    std::optional<std::string_view> path;
    if (info.external_pager && _isAlive()) {
        const int32_t length = platform.proc_regionfilename(pid(), address, buffer, sizeof buffer - 1);
        if (length > 0) {
            buffer[length] = '\0';
            path = std::string_view(buffer);
        }
    }
    *stop = callback(address, size, info, purgeState, path);
}

void HXUserProcess::addImage(const RVSymbolOwner &owner) {
    const HXString path =
        inSharedRegion(owner.baseAddress)
            ? HXSharedImagePath(owner.baseAddress, owner.path)
            : HXString::intern(HXPlatform::current().stringByResolvingSymlinksInPath(owner.path));
    for (size_t i = 0; i < owner.segmentCount; i++) {
        const RVRegion &segment = owner.segments[i];
        std::string_view name = segment.name;
        name = name == "MACH_HEADER" ? "__TEXT" : name.substr(0, name.find(' '));
        HXImage &image = _images.emplace_back();
        image.setStart(segment.start);
        image.setSize(segment.length);
        image.setName(HXSegmentName(name));
        image.setOwnerPath(path);
    }
}

void HXUserProcess::_gatherImageData() {
    HXPlatform &platform = HXPlatform::current();
    const uint32_t flags = platform.RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData() | 0x20101002;
    RVSymbolicator *symbolicator =
        platform.RVSymbolicatorCreateWithTaskFlagsAndNotification(_task, flags, nullptr);
    if (!symbolicator) return;
    platform.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator, kRVNow,
                                                    [this](const RVSymbolOwner &owner) { addImage(owner); });
    platform.RVRelease(symbolicator);
    std::stable_sort(_images.begin(), _images.end(),
                     [](const HXImage &a, const HXImage &b) { return a.start() < b.start(); });
}
