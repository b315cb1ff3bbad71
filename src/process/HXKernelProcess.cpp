#include "process/HXKernelProcess.h"

#include "platform/HXPlatform.h"

#include <array>
#include <cinttypes>
#include <cstdio>
#include <cstring>

namespace {

constexpr uint64_t kUserWiredTag = 24; // VM_KERN_MEMORY_MLOCK

// The kernel's names of its memory tags, by number; tag 255 is "VM_KERN_MEMORY_ANY".
constexpr const char *kTagNames[] = {
    "VM_KERN_MEMORY_NONE",          "VM_KERN_MEMORY_OSFMK",
    "VM_KERN_MEMORY_BSD",           "VM_KERN_MEMORY_DRIVERS",
    "VM_KERN_MEMORY_LIBKERN",       "VM_KERN_MEMORY_OSKEXT",
    "VM_KERN_MEMORY_KEXT",          "VM_KERN_MEMORY_IPC",
    "VM_KERN_MEMORY_STACK",         "VM_KERN_MEMORY_CPU",
    "VM_KERN_MEMORY_PMAP",          "VM_KERN_MEMORY_PTE",
    "VM_KERN_MEMORY_ZONE",          "VM_KERN_MEMORY_KALLOC",
    "VM_KERN_MEMORY_COMPRESSOR",    "VM_KERN_MEMORY_COMPRESSED_DATA",
    "VM_KERN_MEMORY_PHANTOM_CACHE", "VM_KERN_MEMORY_WAITQ",
    "VM_KERN_MEMORY_DIAG",          "VM_KERN_MEMORY_LOG",
    "VM_KERN_MEMORY_FILE",          "VM_KERN_MEMORY_MBUF",
    "VM_KERN_MEMORY_UBC",           "VM_KERN_MEMORY_SECURITY",
    "VM_KERN_MEMORY_MLOCK",         "VM_KERN_MEMORY_REASON",
    "VM_KERN_MEMORY_NETWORK",       "VM_KERN_MEMORY_LTABLE",
    "VM_KERN_MEMORY_FIRST_DYNAMIC",
};
constexpr uint64_t kAnyTag = 255;

// The kernel's names of its counters, by number.
constexpr const char *kCounterNames[] = {
    "VM_KERN_COUNT_MANAGED",       "VM_KERN_COUNT_RESERVED",    "VM_KERN_COUNT_WIRED",
    "VM_KERN_COUNT_WIRED_MANAGED", "VM_KERN_COUNT_STOLEN",      "VM_KERN_COUNT_LOPAGE",
    "VM_KERN_COUNT_MAP_KERNEL",    "VM_KERN_COUNT_MAP_ZONE",    "VM_KERN_COUNT_MAP_KALLOC",
    "VM_KERN_COUNT_WIRED_BOOT",    "VM_KERN_COUNT_BOOT_STOLEN",
};

// Where an object identifier comes from: its high word.
constexpr uint64_t kSourceCode = 1, kSourceZone = 2, kSourceTag = 3, kSourceCounter = 4, kSourceKext = 5;

uint64_t siteType(const mach_memory_info_record &info) {
    return info.flags & VM_KERN_SITE_TYPE;
}

uint64_t objectIdForSite(const mach_memory_info_record &info) {
    uint64_t source = kSourceCode;
    switch (siteType(info)) {
    case VM_KERN_SITE_TAG:
        source = kSourceTag;
        break;
    case VM_KERN_SITE_KMOD:
        source = kSourceKext;
        break;
    case VM_KERN_SITE_COUNTER:
        source = kSourceCounter;
        break;
    }
    return info.site ^ source << 32;
}

template <size_t Width>
std::string textOfField(const char (&field)[Width]) {
    return std::string(field, strnlen(field, Width));
}

std::string hexadecimal(uint64_t number) {
    char text[2 + 16 + 1];
    std::snprintf(text, sizeof text, "0x%" PRIx64, number);
    return text;
}

std::string nameForTag(uint64_t tag) {
    if (tag < std::size(kTagNames)) return kTagNames[tag];
    return tag == kAnyTag ? "VM_KERN_MEMORY_ANY" : "VM_KERN_MEMORY_" + std::to_string(tag);
}

std::string nameForCounter(uint64_t counter) {
    if (counter < std::size(kCounterNames)) return kCounterNames[counter];
    return "VM_KERN_COUNT_" + std::to_string(counter);
}

std::string nameForKext(uint64_t loadTag, const HXKernelProcess::KextTags &kexts) {
    const auto kext = kexts.find(loadTag);
    if (kext != kexts.end() && kext->second.CFBundleIdentifier) return *kext->second.CFBundleIdentifier;
    return "unloaded kmod " + std::to_string(loadTag);
}

std::string nameForCode(uint64_t address, RVSymbolicator *symbolicator) {
    if (address != 0 && symbolicator) {
        HXPlatform &platform = HXPlatform::current();
        const RVSymbol symbol =
            platform.RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator, address, kRVNow);
        if (symbol.name) return symbol.name;
    }
    return "site " + hexadecimal(address);
}

std::string nameForSite(const mach_memory_info_record &info, const HXKernelProcess::KextTags &kexts,
                        RVSymbolicator *symbolicator) {
    if (info.flags & VM_KERN_SITE_NAMED) return textOfField(info.name);
    switch (siteType(info)) {
    case VM_KERN_SITE_TAG:
        return nameForTag(info.site);
    case VM_KERN_SITE_KMOD:
        return nameForKext(info.site, kexts);
    case VM_KERN_SITE_KERNEL:
        return nameForCode(info.site, symbolicator);
    case VM_KERN_SITE_COUNTER:
        return nameForCounter(info.site);
    }
    return "unknown site (" + hexadecimal(siteType(info)) + ", " + hexadecimal(info.site) + ")";
}

// Elements that outgrow the zone leave nothing to take back, even if their size wraps around.
void setZoneSizes(HXMemoryRegion &region, const mach_zone_info &zone) {
    const uint64_t size = zone.mzi_cur_size, elementSize = zone.mzi_elem_size;
    region.setSize(size);
    if (zone.mzi_collectable == 0) {
        region.setDirtySize(size);
        return;
    }
    const uint64_t usedSize = zone.mzi_count * elementSize;
    const bool fits = elementSize == 0 || zone.mzi_count <= size / elementSize;
    region.setDirtySize(usedSize);
    region.setReclaimableSize(fits ? size - usedSize : 0);
}

// Wired memory is the kernel's charge, but for what is hidden, lies in a zone (which is charged as a whole)
// or is locked for a user process (which is charged itself).
void setSiteSizes(HXMemoryRegion &region, const mach_memory_info_record &info) {
    const bool isHidden = (info.flags & VM_KERN_SITE_HIDE) != 0;
    const bool isUserWired = info.site == kUserWiredTag;
    const bool isWired = (info.flags & VM_KERN_SITE_WIRED) != 0;
    region.setSize(info.size);
    region.setWired(isWired);
    if (isWired && !(info.flags & VM_KERN_SITE_ZONE) && !isHidden && !isUserWired) {
        region.setDirtySize(info.size);
        return;
    }
    region.setCleanNonSpecSize(info.size);
    if (isHidden)
        region.setDetailedName("(hidden)");
    else if (isUserWired)
        region.setDetailedName("(user wired)");
}

} // namespace

bool HXKernelProcess::initWithBsdInfo(const proc_bsdinfo &info) {
    if (!HXProcess::initWithBsdInfo(info)) return false;
    _idleExitStatus = HXIdleExitNotSupported;
    _auxData = std::make_shared<HXAuxDictionary>();
    return true;
}

HXAuxTree HXKernelProcess::auxData() const {
    auto tree = std::make_shared<HXAuxDictionary>();
    tree->set("Maps", _auxData);
    return tree;
}

void HXKernelProcess::release(const void *array, uint64_t bytes) const {
    HXPlatform &platform = HXPlatform::current();
    const kern_return_t error = platform.vm_deallocate(platform.mach_task_self(), array, bytes);
    if (error != KERN_SUCCESS)
        std::fprintf(stderr, "%s: vm_deallocate: %s\n", displayString().c_str(),
                     platform.mach_error_string(error));
}

void HXKernelProcess::gatherData() {
    HXPlatform &platform = HXPlatform::current();
    mach_zone_name *zoneNames = nullptr;
    mach_zone_info *zones = nullptr;
    mach_memory_info_record *records = nullptr;
    uint32_t nameCount = 0, zoneCount = 0, recordCount = 0;
    const kern_return_t error = platform.mach_memory_info(platform.mach_host_self(), &zoneNames, &nameCount,
                                                          &zones, &zoneCount, &records, &recordCount);
    if (error != KERN_SUCCESS) {
        const char *reason = platform.mach_error_string(error);
        std::fprintf(stderr, "%s: mach_memory_info: %s\n", displayString().c_str(), reason);
        _errors.push_back(displayString() + ": " + reason);
        return;
    }

    HXMemoryRegionList regions;
    for (uint32_t i = 0; i < zoneCount; i++) {
        HXMemoryRegion &region = regions.emplace_back();
        region.setName(i < nameCount ? textOfField(zoneNames[i].mzn_name) : "unknown");
        setZoneSizes(region, zones[i]);
        region.setDetailedName("zone");
        region.setObject_id((kSourceZone << 32) + i);
    }
    release(zones, uint64_t{zoneCount} * sizeof *zones);
    _addWiredData(records, recordCount, zoneNames, nameCount, regions);
    release(zoneNames, uint64_t{nameCount} * sizeof *zoneNames);
    release(records, uint64_t{recordCount} * sizeof *records);
    setMemoryRegions(std::move(regions));
}

void HXKernelProcess::_addWiredData(const mach_memory_info_record *records, uint32_t count,
                                    const mach_zone_name *zoneNames, uint32_t zoneCount,
                                    HXMemoryRegionList &regions) {
    constexpr uint64_t counterMask = VM_KERN_SITE_TYPE | VM_KERN_SITE_WIRED | VM_KERN_SITE_ZONE;
    RVSymbolicator *symbolicator = _createSymbolicator();
    const KextTags kexts = kextTags();
    for (uint32_t k = 0; k < count; k++) {
        const mach_memory_info_record &info = records[k];
        const bool isCounter = (info.flags & counterMask) == VM_KERN_SITE_COUNTER;
        const uint64_t amount = isCounter ? info.mapped : info.size;
        if (info.site == 0 && amount == 0) continue;
        if (isCounter) {
            _auxData->set(_nameForWiredInfo(info, kexts, symbolicator, nullptr, 0),
                          std::make_shared<HXAuxData>(static_cast<int64_t>(amount), false));
            continue;
        }
        HXMemoryRegion &region = regions.emplace_back();
        setSiteSizes(region, info);
        region.setUser_tag(k);
        region.setObject_id(objectIdForSite(info));
        _setNameForRegion(region, info, kexts, symbolicator, zoneNames, zoneCount);
    }
    HXPlatform::current().RVRelease(symbolicator);
}

HXKernelProcess::KextTags HXKernelProcess::_kextTagsWithKextInfo(const std::vector<OSKextInfo> &kextInfo) {
    KextTags tags;
    for (const OSKextInfo &info : kextInfo)
        tags.insert_or_assign(info.OSBundleLoadTag, info);
    return tags;
}

HXKernelProcess::KextTags HXKernelProcess::kextTags() {
    return _kextTagsWithKextInfo(HXPlatform::current().OSKextCopyLoadedKextInfo());
}

RVSymbolicator *HXKernelProcess::_createSymbolicator() {
    // The library's flags for symbols of the running kernel.
    constexpr uint32_t kernelFlags = 0x100000 | 0x2;
    HXPlatform &platform = HXPlatform::current();
    const uint32_t flags = platform.RVSymbolicatorGetFlagsForNListOnlyData() | kernelFlags;
    return platform.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(flags, nullptr);
}

std::string HXKernelProcess::_nameForWiredInfo(const mach_memory_info_record &info, const KextTags &kexts,
                                               RVSymbolicator *symbolicator, const mach_zone_name *zoneNames,
                                               uint32_t zoneCount) {
    std::string name = nameForSite(info, kexts, symbolicator);
    if (zoneNames && (info.flags & VM_KERN_SITE_ZONE) && info.zone < zoneCount)
        name += "[" + textOfField(zoneNames[info.zone].mzn_name) + "]";
    return name;
}

void HXKernelProcess::_setNameForRegion(HXMemoryRegion &region, const mach_memory_info_record &info,
                                        const KextTags &kexts, RVSymbolicator *symbolicator,
                                        const mach_zone_name *zoneNames, uint32_t zoneCount) {
    region.setName(_nameForWiredInfo(info, kexts, symbolicator, zoneNames, zoneCount));
    if (siteType(info) != VM_KERN_SITE_KERNEL || !symbolicator) return;
    const RVSourceInfo source =
        HXPlatform::current().RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator, info.site, kRVNow);
    if (!source.isNull && source.path)
        region.setDetailedName("(" + std::string(source.path) + ":" + std::to_string(source.lineNumber) +
                               ")");
}
