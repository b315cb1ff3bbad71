#include "process/HXKernelProcess.h"

#include "platform/HXPlatform.h"
#include "platform/capture/HXFixedText.h"

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

std::string hexadecimal(uint64_t number) {
    char text[2 + 16 + 1];
    std::snprintf(text, sizeof text, "0x%" PRIx64, number);
    return text;
}

std::string nameForTag(uint64_t tag, const HXKernelProcess::SiteNames &) {
    if (tag < std::size(kTagNames)) return kTagNames[tag];
    return tag == kAnyTag ? "VM_KERN_MEMORY_ANY" : "VM_KERN_MEMORY_" + std::to_string(tag);
}

std::string nameForCounter(uint64_t counter, const HXKernelProcess::SiteNames &) {
    if (counter < std::size(kCounterNames)) return kCounterNames[counter];
    return "VM_KERN_COUNT_" + std::to_string(counter);
}

std::string nameForKext(uint64_t loadTag, const HXKernelProcess::SiteNames &names) {
    const auto kext = names.kexts.find(loadTag);
    if (kext != names.kexts.end() && kext->second.CFBundleIdentifier) return *kext->second.CFBundleIdentifier;
    return "unloaded kmod " + std::to_string(loadTag);
}

std::string nameForCode(uint64_t address, const HXKernelProcess::SiteNames &names) {
    if (address != 0 && names.symbolicator) {
        const RVSymbol symbol = HXPlatform::current().RVSymbolicatorGetSymbolWithAddressAtTime(
            names.symbolicator.get(), address, kRVNow);
        if (symbol.name) return symbol.name;
    }
    return "site " + hexadecimal(address);
}

// What sites of one type have in common.
struct SiteKind {
    uint64_t type;
    uint64_t source; // of their object identifiers
    std::string (*name)(uint64_t site, const HXKernelProcess::SiteNames &names);
};
constexpr SiteKind kSiteKinds[] = {
    {VM_KERN_SITE_TAG, kSourceTag, nameForTag},
    {VM_KERN_SITE_KMOD, kSourceKext, nameForKext},
    {VM_KERN_SITE_KERNEL, kSourceCode, nameForCode},
    {VM_KERN_SITE_COUNTER, kSourceCounter, nameForCounter},
};

// Null for types that a newer kernel has.
const SiteKind *kindOfSite(const mach_memory_info_record &info) {
    for (const SiteKind &kind : kSiteKinds)
        if (kind.type == siteType(info)) return &kind;
    return nullptr;
}

uint64_t objectIdForSite(const mach_memory_info_record &info) {
    const SiteKind *const kind = kindOfSite(info);
    return info.site ^ (kind ? kind->source : kSourceCode) << 32;
}

std::string nameForSite(const mach_memory_info_record &info, const HXKernelProcess::SiteNames &names) {
    if (info.flags & VM_KERN_SITE_NAMED) return std::string(HXTextOfField(info.name));
    if (const SiteKind *const kind = kindOfSite(info)) return kind->name(info.site, names);
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

bool HXKernelProcess::initWithBsdInfo(const proc_bsdinfo &info, HXProcessSnapshot *snapshot) {
    if (!HXProcess::initWithBsdInfo(info, snapshot)) return false;
    _idleExitStatus = HXIdleExitNotSupported;
    return true;
}

HXAuxTree HXKernelProcess::auxData() const {
    auto tree = std::make_shared<HXAuxDictionary>();
    tree->set("Maps", _auxData);
    return tree;
}

void HXKernelProcess::gatherData() {
    HXPlatform &platform = HXPlatform::current();
    HXKernelArray<mach_zone_name> zoneNames(platform);
    HXKernelArray<mach_zone_info> zones(platform);
    HXKernelArray<mach_memory_info_record> records(platform);
    const kern_return_t error =
        platform.mach_memory_info(platform.mach_host_self(), &zoneNames.array, &zoneNames.count, &zones.array,
                                  &zones.count, &records.array, &records.count);
    if (error != KERN_SUCCESS) {
        const char *reason = platform.mach_error_string(error);
        std::fprintf(stderr, "%s: mach_memory_info: %s\n", displayString().c_str(), reason);
        _errors.push_back(displayString() + ": " + reason);
        return;
    }
    const auto release = [&](auto &array) {
        const kern_return_t failure = array.release();
        if (failure != KERN_SUCCESS)
            std::fprintf(stderr, "%s: vm_deallocate: %s\n", displayString().c_str(),
                         platform.mach_error_string(failure));
    };
    _addZones(zones.records(), zoneNames.records());
    release(zones);
    _addWiredData(records.records(), zoneNames.records());
    release(zoneNames);
    release(records);
}

void HXKernelProcess::_addZones(std::span<const mach_zone_info> zones, ZoneNames names) {
    for (size_t i = 0; i < zones.size(); i++) {
        HXMemoryRegion &region = _memoryRegions.emplace_back();
        region.setName(i < names.size() ? HXTextOfField(names[i].mzn_name) : "unknown");
        setZoneSizes(region, zones[i]);
        region.setDetailedName("zone");
        region.setObject_id((kSourceZone << 32) + i);
    }
}

void HXKernelProcess::_addWiredData(std::span<const mach_memory_info_record> records, ZoneNames zoneNames) {
    constexpr uint64_t counterMask = VM_KERN_SITE_TYPE | VM_KERN_SITE_WIRED | VM_KERN_SITE_ZONE;
    const SiteNames names{kextTags(), _createSymbolicator(), zoneNames};
    for (size_t k = 0; k < records.size(); k++) {
        const mach_memory_info_record &info = records[k];
        const bool isCounter = (info.flags & counterMask) == VM_KERN_SITE_COUNTER;
        const uint64_t amount = isCounter ? info.mapped : info.size;
        if (info.site == 0 && amount == 0) continue;
        if (isCounter) {
            _auxData->set(_nameForWiredInfo(info, names),
                          std::make_shared<HXAuxData>(static_cast<int64_t>(amount), false));
            continue;
        }
        HXMemoryRegion &region = _memoryRegions.emplace_back();
        setSiteSizes(region, info);
        region.setUser_tag(static_cast<uint32_t>(k));
        region.setObject_id(objectIdForSite(info));
        _setNameForRegion(region, info, names);
    }
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

HXSymbolicatorGuard HXKernelProcess::_createSymbolicator() {
    // The library's flags for symbols of the running kernel.
    constexpr uint32_t kernelFlags = 0x100000 | 0x2;
    HXPlatform &platform = HXPlatform::current();
    return HXSymbolicatorOfKernel(platform, platform.RVSymbolicatorGetFlagsForNListOnlyData() | kernelFlags);
}

std::string HXKernelProcess::_nameForWiredInfo(const mach_memory_info_record &info, const SiteNames &names) {
    std::string name = nameForSite(info, names);
    if ((info.flags & VM_KERN_SITE_ZONE) && info.zone < names.zones.size())
        name += "[" + std::string(HXTextOfField(names.zones[info.zone].mzn_name)) + "]";
    return name;
}

void HXKernelProcess::_setNameForRegion(HXMemoryRegion &region, const mach_memory_info_record &info,
                                        const SiteNames &names) {
    region.setName(_nameForWiredInfo(info, names));
    if (siteType(info) != VM_KERN_SITE_KERNEL || !names.symbolicator) return;
    const RVSourceInfo source = HXPlatform::current().RVSymbolicatorGetSourceInfoWithAddressAtTime(
        names.symbolicator.get(), info.site, kRVNow);
    if (!source.isNull && source.path)
        region.setDetailedName("(" + std::string(source.path) + ":" + std::to_string(source.lineNumber) +
                               ")");
}
