#include "platform/linux/memory/HXMappingClass.h"

#include "platform/HXRegionTags.h"

#include <algorithm>

namespace {

constexpr std::string_view kDeletedSuffix = " (deleted)";
constexpr std::string_view kAnonymousPrefix = "[anon:";
constexpr std::string_view kSharedPrefix = "[anon_shmem:";

bool isAccessible(const HXMapping &mapping) {
    return mapping.has(HXMappingReadable | HXMappingWritable | HXMappingExecutable);
}

uint64_t residentPages(const HXMapping &mapping) {
    return uint64_t{mapping.residentPages} + mapping.hugePages;
}

uint32_t saturated(uint64_t pages) {
    return static_cast<uint32_t>(std::min<uint64_t>(pages, UINT32_MAX));
}

uint64_t difference(uint64_t whole, uint64_t part) {
    return whole - std::min(whole, part);
}

// Resident pages that the kernel cannot drop without swapping, and that go with their last mapping. Lazily
// freed pages are not among them, nor what a mapping at a lower address is charged for.
uint64_t chargedPages(const HXMapping &mapping) {
    uint64_t pages = difference(mapping.anonymousPages, mapping.lazyFreePages) + mapping.hugePages;
    if (mapping.has(HXMappingSwapBacked)) pages += difference(mapping.residentPages, mapping.anonymousPages);
    return difference(pages, mapping.repeatedPages);
}

uint8_t tagOf(const HXMapping &mapping, uint8_t namedTag) {
    if (mapping.kind == HXPathKind::stack) return HXHostTagStack;
    if (!isAccessible(mapping)) return HXHostTagGuard;
    if (namedTag != 0) return namedTag;
    const bool huge = mapping.has(HXMappingHugePages);
    const bool isShared = mapping.has(HXMappingShared) || mapping.isFile();
    switch (mapping.kind) {
    case HXPathKind::heap:
        return HXHostTagHeap;
    case HXPathKind::systemV:
        return HXHostTagSystemVSharedMemory;
    case HXPathKind::memfd:
        return HXHostTagMemfd;
    case HXPathKind::deletedFile:
        if (huge) break;
        if (mapping.has(HXMappingSwapBacked)) return HXHostTagDeletedSharedMemory;
        return 0;
    case HXPathKind::file:
        if (mapping.has(HXMappingHasPager)) return 0;
        break;
    default:
        break;
    }
    if (huge) return HXHostTagHugePages;
    if (isShared) return HXHostTagSharedAnonymous;
    return mapping.has(HXMappingExecutable) ? HXHostTagAnonymousCode : HXHostTagAnonymous;
}

// The kinds of shared memory that the kernel makes without a name on a file system.
bool isNamelessSharedMemory(HXPathKind kind) {
    return kind == HXPathKind::sharedAnonymous || kind == HXPathKind::systemV || kind == HXPathKind::memfd ||
           kind == HXPathKind::namedShared || kind == HXPathKind::anonymousHuge;
}

bool hasPager(const HXMapping &mapping) {
    if (!mapping.isFile() || isNamelessSharedMemory(mapping.kind)) return false;
    const bool nameIsGone = mapping.kind == HXPathKind::deletedFile;
    return !(nameIsGone && mapping.has(HXMappingSwapBacked | HXMappingHugePages));
}

uint8_t shareModeOf(const HXMapping &mapping) {
    if (!isAccessible(mapping) && residentPages(mapping) == 0 && mapping.swappedPages == 0) return SM_EMPTY;
    if (mapping.has(HXMappingShared)) return SM_SHARED;
    if (mapping.kind == HXPathKind::vdso) return SM_COW;
    return HXIsPrivateAnonymous(mapping) ? SM_PRIVATE : SM_COW;
}

uint32_t reportedDirtyPages(const HXMapping &mapping, bool reportsCharge) {
    if (reportsCharge) return saturated(chargedPages(mapping));
    if (mapping.has(HXMappingHasPager) && !mapping.has(HXMappingSwapBacked | HXMappingHugePages))
        return mapping.dirtyPages;
    return saturated(residentPages(mapping));
}

int32_t protectionOf(const HXMapping &mapping, uint16_t read, uint16_t write, uint16_t execute) {
    return (mapping.has(read) ? VM_PROT_READ : 0) | (mapping.has(write) ? VM_PROT_WRITE : 0) |
           (mapping.has(execute) ? VM_PROT_EXECUTE : 0);
}

} // namespace

HXPathKind HXPathKindOf(std::string_view path) {
    if (path.empty()) return HXPathKind::none;
    if (path.front() == '[') {
        if (path == "[heap]") return HXPathKind::heap;
        // Kernels before 4.5 tell the stacks of threads as [stack:TID].
        if (path == "[stack]" || path.starts_with("[stack:")) return HXPathKind::stack;
        if (path == "[vdso]") return HXPathKind::vdso;
        if (path.starts_with(kAnonymousPrefix)) return HXPathKind::namedAnonymous;
        if (path.starts_with(kSharedPrefix)) return HXPathKind::namedShared;
        return HXPathKind::special;
    }
    if (!path.ends_with(kDeletedSuffix)) return HXPathKind::file;
    if (path == "/dev/zero (deleted)") return HXPathKind::sharedAnonymous;
    if (path == "/anon_hugepage (deleted)") return HXPathKind::anonymousHuge;
    if (path.starts_with("/SYSV")) return HXPathKind::systemV;
    if (path.starts_with("/memfd:")) return HXPathKind::memfd;
    return HXPathKind::deletedFile;
}

std::string_view HXGivenName(std::string_view path) {
    if (!path.ends_with(']')) return {};
    for (const std::string_view prefix : {kAnonymousPrefix, kSharedPrefix})
        if (path.starts_with(prefix)) return path.substr(prefix.size(), path.size() - prefix.size() - 1);
    return {};
}

bool HXIsPrivateAnonymous(const HXMapping &mapping) {
    if (mapping.has(HXMappingShared)) return false;
    return !mapping.isFile() || mapping.kind == HXPathKind::anonymousHuge;
}

bool HXHoldsOwnPages(const HXMapping &mapping) {
    if (mapping.has(HXMappingShared) || mapping.kind == HXPathKind::vdso) return false;
    return HXIsPrivateAnonymous(mapping) || mapping.anonymousPages > 0 || mapping.swappedPages > 0 ||
           mapping.hugePages > 0;
}

bool HXMayShareAfterFork(const HXMapping &mapping) {
    constexpr uint64_t kernelHalf = uint64_t{1} << 63; // where the gate page is
    return !mapping.has(HXMappingShared) && mapping.kind != HXPathKind::vdso &&
           mapping.kind != HXPathKind::special && mapping.start < kernelHalf;
}

void HXClassifyMapping(HXPathKind kind, HXFileSystemKind fileSystem, uint32_t sharedMemoryDevice,
                       uint8_t namedTag, HXMapping *mapping) {
    const bool huge = mapping->has(HXMappingHugePages);
    const bool kernelsOwn = mapping->isFile() && mapping->device == sharedMemoryDevice;
    if (isNamelessSharedMemory(kind) && !kernelsOwn && !huge) kind = HXPathKind::deletedFile;
    mapping->kind = kind;
    if (!huge && (kernelsOwn || (mapping->isFile() && fileSystem == HXFileSystemKind::swapBacked)))
        mapping->flags |= HXMappingSwapBacked;
    if (hasPager(*mapping)) mapping->flags |= HXMappingHasPager;
    mapping->tag = tagOf(*mapping, namedTag);
}

vm_region_submap_info_64 HXRegionInfo(const HXMapping &mapping, uint64_t objectID, bool reportsCharge) {
    constexpr uint32_t inheritCopy = 1, inheritNone = 2; // VM_INHERIT_…
    vm_region_submap_info_64 info{};
    info.protection = protectionOf(mapping, HXMappingReadable, HXMappingWritable, HXMappingExecutable);
    info.max_protection = protectionOf(mapping, HXMappingMayRead, HXMappingMayWrite, HXMappingMayExecute);
    info.inheritance = mapping.has(HXMappingNotInherited) ? inheritNone : inheritCopy;
    info.offset = HXIsPrivateAnonymous(mapping) ? 0 : mapping.offset;
    info.user_tag = mapping.tag;
    info.pages_resident = saturated(residentPages(mapping));
    info.pages_swapped_out =
        static_cast<uint32_t>(difference(mapping.swappedPages, mapping.repeatedSwappedPages));
    info.pages_dirtied = reportedDirtyPages(mapping, reportsCharge);
    info.ref_count = 1;
    info.external_pager = mapping.has(HXMappingHasPager) ? 1 : 0;
    info.share_mode = shareModeOf(mapping);
    info.user_wired_count = mapping.has(HXMappingLocked | HXMappingHugePages) ? 1 : 0;
    info.pages_reusable = mapping.lazyFreePages;
    info.object_id_full = objectID;
    info.object_id = static_cast<uint32_t>(info.object_id_full ^ info.object_id_full >> 32);
    if (info.object_id == 0) info.object_id = 1;
    return info;
}
