// From the walk to the list of regions.
#include "model/HXHeftSwitches.h"
#include "platform/HXPlatform.h"
#include "process/HXUserProcess.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <utility>

namespace {

// The user tag of memory that several processes have a hand in: never taken as owned by the one that maps it.
constexpr uint32_t kNeverOwnedTag = 87;

// What of `all` is left after `taken`; a kernel whose counts disagree leaves none.
uint64_t left(uint64_t all, uint64_t taken) {
    return all > taken ? all - taken : 0;
}

// What an owned object adds to its owner's heft becomes the region's.
void takeChargeOf(HXMemoryRegion &region, const owned_vmobject &object) {
    constexpr uint64_t notCharged = 1;
    region.setOwnedExclusivelyByParentProcess(true);
    region.setReclaimableSize(object.reusable_size);
    const bool isCharged = !(object.flags & notCharged);
    const auto purgeState = static_cast<int32_t>(object.flags >> 4 & 3);
    const bool canBePurged = purgeState == VM_PURGABLE_VOLATILE || purgeState == VM_PURGABLE_EMPTY;
    const uint64_t dirty = canBePurged ? object.wired_size : left(object.resident_size, object.reusable_size);
    region.setDirtySize(isCharged ? dirty : 0);
    region.setSwappedSize(isCharged && !canBePurged ? object.compressed_size : 0);
}

} // namespace

// What one gathering's walk and its closing steps share.
struct HXUserProcess::Gathering {
    explicit Gathering(HXUserProcess &process)
        : enumerator(process._images), cutter(process.pageSize(), enumerator, regions, process.pageQuery()),
          hidden(process.hiddenFromDisplay()), breakDown(process.breakDownPhysHeft()),
          cutsRuns(breakDown && !hidden && process._isAlive() &&
                   !HXHeftSwitches::isSharingAnalysisDisabled()),
          takesParts(process._isAlive() && !HXHeftSwitches::isSharingAnalysisDisabled()) {}

    // HXMemoryRegion::categoryNameForTag. A process has few tags, which the host is asked for once.
    HXString nameOfTag(uint32_t tag) {
        auto &[known, name] = tagNames[tag % tagNames.size()];
        if (!name || known != tag) {
            known = tag;
            name = HXMemoryRegion::categoryNameForTag(tag);
        }
        return name;
    }

    HXMemoryRegionList regions;
    HXMemoryRegionList parts; // of these
    std::array<std::pair<uint32_t, HXString>, 16> tagNames;
    HXImageEnumerator enumerator;
    HXSharedRegionCutter cutter;
    const bool hidden;
    const bool breakDown;
    const bool cutsRuns;
    const bool takesParts;
    std::optional<HXMemoryRegion> unmappedRegion; // built from the kernel's fake region
    // Dirty and swapped bytes charged to mapped regions from owned objects: the kernel's fake region counts
    // them, too.
    uint64_t attributed = 0;
};

void HXUserProcess::gatherData() {
    if (!hiddenFromDisplay()) {
        if (_isAlive()) _gatherImageData(); // others' images come with their regions
        _gatherPhysHeft();
        if (_isAlive()) _ownedVmObjects = _gatherOwnedVmObjects();
    }
    _gatherMemoryData();
    if (!hiddenFromDisplay() && _isAlive()) _gatherHeldObjects();
    _images = {};
    _task.close();
}

// Descriptors are many: where the whole machine is examined they are asked for only if the rest leaves much
// open (HXHeft).
void HXUserProcess::_gatherHeldObjects() {
    HXPlatform &platform = HXPlatform::current();
    _heldObjects = platform.task_held_objects(_task.get());
    if (HXHeftSwitches::examinesWholeMachine()) return;
    const auto open = platform.proc_held_objects(pid());
    _heldObjects.insert(_heldObjects.end(), open.begin(), open.end());
}

std::optional<HXOwnedVmObjects> HXUserProcess::_gatherOwnedVmObjects() {
    constexpr size_t slack = 0x380; // sixteen objects that appear between two calls
    if (!HXHeftSwitches::breakDownPhysHeft()) return std::nullopt;
    HXPlatform &platform = HXPlatform::current();
    const mach_port_t task = _task.get();
    size_t size = 0;
    if (platform.sysctlbyname(kOwnedObjectsSetting, nullptr, &size, &task, sizeof task) != 0) {
        if (errno != ENOENT) _addErrnoWarningWithDescription(kOwnedObjectsSetting);
        return std::nullopt;
    }
    HXOwnedVmObjects objects;
    if (size == 0) return objects;

    std::vector<unsigned char> reply;
    size_t length = 0;
    do {
        size += slack;
        reply.resize(size);
        length = size;
        if (platform.sysctlbyname(kOwnedObjectsSetting, reply.data(), &length, &task, sizeof task) != 0) {
            _addErrnoWarningWithDescription(kOwnedObjectsSetting);
            return std::nullopt;
        }
    } while (length == size); // a full buffer may have cut the reply
    if (length == 0) return objects;

    uint64_t count = 0;
    HXRequire(length >= sizeof count, "_gatherOwnedVmObjects", "the reply holds a count");
    memcpy(&count, reply.data(), sizeof count);
    HXRequire(count <= (length - sizeof count) / sizeof(owned_vmobject), "_gatherOwnedVmObjects",
              "the reply holds all its records");
    for (uint64_t i = 0; i < count; i++) {
        owned_vmobject object;
        memcpy(&object, reply.data() + sizeof count + i * sizeof object, sizeof object);
        objects.add(object);
    }
    return objects;
}

void HXUserProcess::_gatherMemoryData() {
    Gathering gathering(*this);
    enumerateRegions([&](uint64_t start, uint64_t size, const vm_region_submap_info_64 &info,
                         int32_t purgeState, std::optional<std::string_view> path) {
        return addRegion(gathering, start, size, info, purgeState, path);
    });
    warnOfMovedMemory();
    addUnmappedOwnedObjects(gathering);
    addUnmappedHeft(gathering);
    addPageTables(gathering);
    std::move(gathering.parts.begin(), gathering.parts.end(), std::back_inserter(gathering.regions));
    _memoryRegions = std::move(gathering.regions);
}

void HXUserProcess::warnOfMovedMemory() {
    if (!_isAlive()) return;
    const auto difference = HXPlatform::current().walkDifference(_task.get());
    if (!difference) return;
    _warnings.push_back(displayString() + ": memory changed while it was read: regions " +
                        std::to_string(difference->regionsSize) + " bytes, counters " +
                        std::to_string(difference->countersSize) + " bytes");
}

// Returns true to stop the walk.
bool HXUserProcess::addRegion(Gathering &gathering, uint64_t start, uint64_t size,
                              const vm_region_submap_info_64 &info, int32_t purgeState,
                              std::optional<std::string_view> path) {
    if (_sharedRegion.contains(start)) {
        if (gathering.hidden || gathering.cutter._addRegionsToArray(start, size, info)) return false;
        printBailingOut();
        return true;
    }
    HXMemoryRegion region;
    region.setStart(start);
    region.setSize(size);
    region.setUser_tag(info.user_tag);
    region.setObject_id(info.object_id_full);
    region.setShare_mode(info.share_mode);
    region.setOffset(info.offset);
    region.setWired(info.user_wired_count != 0);

    bool isUnmappedRegion = false;
    if (purgeState == VM_PURGABLE_VOLATILE) {
        region.setReclaimableSize(uint64_t{info.pages_resident} * pageSize());
    } else if (purgeState == VM_PURGABLE_EMPTY) {
        region.setReclaimableSize(size);
    } else {
        setSizes(region, gathering, info);
        if (info.user_tag == kFakeRegionTag) {
            if (_ownedVmObjects) return false; // the owned objects stand for that memory instead
            if (info.object_id_full == 0) region.setObject_id(info.object_id);
            isUnmappedRegion = true;
        }
    }
    nameRegion(region, gathering, info, purgeState, path);
    if (gathering.takesParts && (region.share_mode() == SM_PRIVATE || region.share_mode() == SM_COW))
        takeParts(region, gathering);
    if (gathering.cutsRuns && region.eligibleForSubrangesUsingPageSize(pageSize()))
        _addSubrangesForRegion(region, purgeState);

    if (isUnmappedRegion)
        gathering.unmappedRegion = std::move(region);
    else
        gathering.regions.push_back(std::move(region));
    return false;
}

void HXUserProcess::setSizes(HXMemoryRegion &region, const Gathering &gathering,
                             const vm_region_submap_info_64 &info) const {
    const uint64_t dirtyPages = info.external_pager || gathering.breakDown
                                    ? info.pages_dirtied
                                    : left(info.pages_resident, info.pages_reusable);
    region.setDirtySize(dirtyPages * pageSize());
    region.setReclaimableSize(uint64_t{info.pages_reusable} * pageSize());
    region.setSwappedSize(uint64_t{info.pages_swapped_out} * pageSize());
    region.setCleanNonSpecSize(left(info.pages_resident, dirtyPages + info.pages_reusable) * pageSize());
}

// What other processes share becomes parts of the region, each in the object that all of them share.
void HXUserProcess::takeParts(HXMemoryRegion &region, Gathering &gathering) const {
    if (region.sizes().heft() == 0) return;
    for (const vm_region_share &share :
         HXPlatform::current().mach_vm_region_shares(_task.get(), region.start()))
        gathering.parts.push_back(region.takePart(
            share.object_id, {share.pages_resident * pageSize(), share.pages_swapped_out * pageSize()},
            {share.pages_resident_counted * pageSize(), share.pages_swapped_out_counted * pageSize()}));
}

void HXUserProcess::nameRegion(HXMemoryRegion &region, Gathering &gathering,
                               const vm_region_submap_info_64 &info, int32_t purgeState,
                               std::optional<std::string_view> path) {
    static const HXString mappedFile = HXString::intern("mapped file");
    region.setSegment(HXSegmentNoImage);
    const uint64_t end = region.start() + region.size();
    if (const HXImage *image = gathering.enumerator.nextImageForStart(region.start(), end)) {
        region.setName(image->name());
        region.setDetailedName(image->ownerPath());
        region.setSegment(image->segment());
    } else if (path || info.external_pager) {
        region.setName(mappedFile);
        if (path) region.setDetailedName(*path);
    } else {
        region.setName(gathering.nameOfTag(info.user_tag));
        if (gathering.breakDown) chargeOwnedObject(region, gathering, info, purgeState);
    }
}

void HXUserProcess::chargeOwnedObject(HXMemoryRegion &region, Gathering &gathering,
                                      const vm_region_submap_info_64 &info, int32_t purgeState) {
    if (_ownedVmObjects) {
        const auto object = _ownedVmObjects->take(info.object_id_full);
        if (!object) return;
        takeChargeOf(region, *object);
        region.setCleanNonSpecSize(0);
        gathering.attributed += region.dirtySize() + region.swappedSize();
    } else if (purgeState != VM_PURGABLE_DENY && info.user_tag != kNeverOwnedTag &&
               info.pages_resident != 0) {
        region.setOwnedExclusivelyByParentProcess(true);
        region.setDirtySize(region.dirtySize() + region.cleanNonSpecSize());
        region.setCleanNonSpecSize(0);
        region.setSwappedSize(0);
        gathering.attributed += region.dirtySize();
    }
}

// Owned objects that no mapping showed become regions without an address.
void HXUserProcess::addUnmappedOwnedObjects(Gathering &gathering) {
    if (!_ownedVmObjects) return;
    _ownedVmObjects->forEach([&](const owned_vmobject &object) {
        HXMemoryRegion &region = gathering.regions.emplace_back();
        takeChargeOf(region, object);
        region.setObject_id(object.object_id);
        region.setUser_tag(kFakeRegionTag);
        region.setName(HXMemoryRegion::categoryNameForTag(kFakeRegionTag));
        region.setSize(object.virtual_size);
        region.setStart(kNoAddress);
        region.setShare_mode(SM_SHARED);
        region.setWired(object.wired_size != 0);
    });
    _ownedVmObjects.reset();
}

// What the kernel's fake region holds beyond the bytes that mapped regions were already charged for.
void HXUserProcess::addUnmappedHeft(Gathering &gathering) {
    if (!gathering.unmappedRegion) return;
    HXMemoryRegion &region = *gathering.unmappedRegion;
    const uint64_t fromDirty = std::min(gathering.attributed, region.dirtySize());
    const uint64_t fromSwapped = std::min(gathering.attributed - fromDirty, region.swappedSize());
    const uint64_t excess = gathering.attributed - fromDirty - fromSwapped;
    region.setDirtySize(region.dirtySize() - fromDirty);
    region.setSwappedSize(region.swappedSize() - fromSwapped);
    if (excess != 0)
        _warnings.push_back(displayString() +
                            ": Heft changed while analyzing \u2013 unmapped owned physical heft may be "
                            "over-counted by " +
                            std::to_string(excess) + " bytes");
    if (region.dirtySize() == 0 && region.swappedSize() == 0) return;
    region.setStart(kNoAddress);
    gathering.regions.push_back(std::move(region));
}

void HXUserProcess::addPageTables(Gathering &gathering) {
    if (!gathering.breakDown || _ledgers[0] == 0) return;
    HXMemoryRegion &region = gathering.regions.emplace_back();
    region.setSize(_ledgers[0]);
    region.setDirtySize(_ledgers[0]);
    region.setStart(kNoAddress);
    region.setName("page table");
    region.setObject_id(HXPlatform::current().pageTableObject(_task.get()));
    region.setShare_mode(SM_PRIVATE);
}
