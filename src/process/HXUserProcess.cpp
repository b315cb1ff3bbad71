// Construction and the walk of the address space.
#include "process/HXUserProcess.h"

#include "platform/HXPlatform.h"
#include "process/HXImageStringCache.h"
#include "process/HXProcessSnapshot.h"

#include <algorithm>
#include <cerrno>

bool HXUserProcess::initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot) {
    if (!HXProcess::initWithBsdInfo(info, snapshot)) return false;
    _setSharedRegionFromPlatform(is64bit() ? HXPlatformARM64 : HXPlatformARM32);
    _gatherPhysHeft();
    _gatherLedgers();
    _gatherIdleExitStatus();
    return true;
}

// Whether a process has gone, or become a zombie, since its record was read.
static bool hasEndedMeanwhile(int32_t pid, HXProcessSnapshot *snapshot) {
    proc_bsdshortinfo now{};
    errno = 0;
    if (HXPlatform::current().proc_pidinfo(pid, PROC_PIDT_SHORTBSDINFO, 1, &now, sizeof now) !=
        int32_t{sizeof now})
        return errno == ESRCH;
    const auto before = snapshot ? snapshot->bsdInfoOfPid(pid) : std::nullopt;
    return now.pbsi_status == SZOMB && before && before->pbi_status != SZOMB;
}

bool HXUserProcess::_populateTask(HXProcessSnapshot *snapshot) {
    HXPlatform &platform = HXPlatform::current();
    const kern_return_t error = snapshot ? snapshot->takeTask(pid(), &_task) : _task.open(pid());
    if (error == KERN_SUCCESS) return true;
    if (error == KERN_FAILURE && hasEndedMeanwhile(pid(), snapshot)) return false; // nobody's failure
    platform.mach_error("task_for_pid", error);
    _addGlobalError("task_for_pid [" + std::to_string(pid()) + "] " + platform.mach_error_string(error));
    return false;
}

bool HXUserProcess::_hostHasSharedRegion() const {
    return HXPlatform::current().hasSharedRegion();
}

bool HXUserProcess::_setSharedRegionFromPlatform(int32_t platform) {
    const auto region = HXSharedRegion::ofPlatform(platform);
    if (!region) {
        std::fputs("Unable to determine platform architecture of target\n", stderr);
        return false;
    }
    _sharedRegion = _hostHasSharedRegion() ? *region : HXSharedRegion();
    return true;
}

void HXUserProcess::printBailingOut() const {
    std::fprintf(stderr, "bailing out for process %s; data may be incomplete!\n", displayString().c_str());
}

// Ends the walk, at the end of the address space without a word.
void HXUserProcess::walkEnded(const char *call, kern_return_t error) {
    if (error == KERN_INVALID_ADDRESS) return;
    HXPlatform::current().mach_error(call, error);
    printBailingOut();
    _processMachVMError(error, MACH_SEND_INVALID_DEST);
}

uint64_t HXUserProcess::_lastNonSharedCacheRegion() {
    constexpr uint64_t tolerance = 0x1000000;
    HXPlatform &platform = HXPlatform::current();
    uint64_t low = 0;
    uint64_t high = _sharedRegion.base;
    while (high > low && high - low > tolerance) {
        const uint64_t middle = high / 2 + low / 2;
        uint64_t start = middle;
        uint64_t size = 0;
        vm_region_basic_info_64 info{};
        uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
        if (platform.mach_vm_region(_task.get(), &start, &size, VM_REGION_BASIC_INFO_64, &info, &count) !=
            KERN_SUCCESS)
            break;
        if (start == low) break;
        if (start < _sharedRegion.base)
            low = start;
        else
            high = middle - pageSize();
    }
    return low;
}

void HXUserProcess::enumerateRegions(const HXRegionCallback &callback) {
    HXPlatform &platform = HXPlatform::current();
    const uint64_t last = _lastNonSharedCacheRegion();
    uint64_t address = 0;
    uint64_t size = 0;
    bool seenFakeRegion = false;
    for (bool stop = false; !stop; address += size) {
        if (last != 0 && address >= last && address < _sharedRegion.end()) {
            const uint64_t asked = address;
            vm_region_basic_info_64 basic{};
            uint32_t count = VM_REGION_BASIC_INFO_COUNT_64;
            const kern_return_t error = platform.mach_vm_region(_task.get(), &address, &size,
                                                                VM_REGION_BASIC_INFO_64, &basic, &count);
            address = std::max(address, asked);
            if (error != KERN_SUCCESS) return walkEnded("mach_vm_region", error);
            if (_sharedRegion.contains(address)) {
                stop =
                    callback(address, size, HXInfoOfSharedRegionEntry(basic), VM_PURGABLE_DENY, std::nullopt);
                continue;
            }
        }
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX; // down to the leaves
        uint32_t count = VM_REGION_SUBMAP_INFO_COUNT_64;
        const kern_return_t error =
            platform.mach_vm_region_recurse(_task.get(), &address, &size, &depth, &info, &count);
        if (error != KERN_SUCCESS) return walkEnded("mach_vm_region_recurse", error);
        if (count <= VM_REGION_SUBMAP_INFO_V1_COUNT_64) info.object_id_full = info.object_id;
        // The fake region that the kernel reports after the last mapping closes the walk.
        if (info.user_tag != kFakeRegionTag && seenFakeRegion) return;
        seenFakeRegion = info.user_tag == kFakeRegionTag;
        stop = handOverRegion(address, size, info, callback);
    }
}

bool HXUserProcess::handOverRegion(uint64_t address, uint64_t size, const vm_region_submap_info_64 &info,
                                   const HXRegionCallback &callback) {
    HXRequire(!info.is_submap, "HXUserProcess enumerateRegions", "a full-depth recursion ends at a leaf");
    HXPlatform &platform = HXPlatform::current();
    int32_t purgeState = VM_PURGABLE_DENY;
    if (platform.mach_vm_purgable_control(_task.get(), address, VM_PURGABLE_GET_STATE, &purgeState) !=
        KERN_SUCCESS)
        purgeState = VM_PURGABLE_DENY;
    char buffer[kMaxPathBytes];
    std::optional<std::string_view> path;
    if (info.external_pager) {
        const int32_t length = platform.proc_regionfilename(pid(), address, buffer, sizeof buffer);
        if (length > 0) path = std::string_view(buffer, static_cast<size_t>(length));
    }
    return callback(address, size, info, purgeState, path);
}

void HXUserProcess::addImage(const RVSymbolOwner &owner) {
    const HXString path =
        _sharedRegion.contains(owner.baseAddress)
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
    // The library's flags for images without symbols, as the task has them mapped now.
    constexpr uint32_t imagesOnly = 0x20101002;
    HXPlatform &platform = HXPlatform::current();
    const uint32_t flags = platform.RVSymbolicatorGetFlagsForNoSymbolOrSourceInfoData() | imagesOnly;
    const HXSymbolicatorGuard symbolicator = HXSymbolicatorOfTask(platform, _task.get(), flags);
    if (!symbolicator) return;
    platform.RVSymbolicatorForeachSymbolOwnerAtTime(symbolicator.get(), kRVNow,
                                                    [this](const RVSymbolOwner &owner) { addImage(owner); });
    std::stable_sort(_images.begin(), _images.end(),
                     [](const HXImage &a, const HXImage &b) { return a.start() < b.start(); });
}
