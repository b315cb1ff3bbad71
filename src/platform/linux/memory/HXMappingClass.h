// What a mapping's figures, path and file system mean: its class, its charge and its region record. Pure.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/memory/HXFileSystemKind.h"
#include "platform/linux/memory/HXMapping.h"

#include <cstdint>
#include <string_view>

// What the path column of maps says.
enum class HXPathKind : uint8_t {
    none,
    file,
    deletedFile,     // FILE (deleted)
    heap,            // [heap]
    stack,           // [stack]
    vdso,            // [vdso]
    special,         // other names in brackets
    namedAnonymous,  // [anon:NAME]
    namedShared,     // [anon_shmem:NAME]
    sharedAnonymous, // /dev/zero (deleted)
    systemV,         // /SYSVKEY (deleted)
    memfd,           // /memfd:NAME (deleted)
    anonymousHuge,   // /anon_hugepage (deleted)
};
HXPathKind HXPathKindOf(std::string_view path);
// NAME of [anon:NAME] and [anon_shmem:NAME]; empty for other paths.
std::string_view HXGivenName(std::string_view path);

// Completes `mapping` (kind, tag, and the flags that classification finds out). `sharedMemoryDevice`: the
// device of the kernel's own tmpfs, on which shared memory without a name lies; a path alone proves nothing,
// since a file may have any. `namedTag`: the user tag of the name that a program gave its memory; 0 when
// there is none.
void HXClassifyMapping(HXPathKind kind, HXFileSystemKind fileSystem, uint32_t sharedMemoryDevice,
                       uint8_t namedTag, HXMapping *mapping);

inline uint64_t HXResidentPages(const HXMapping &mapping) {
    return uint64_t{mapping.residentPages} + mapping.hugePages;
}
// Resident pages that the kernel cannot drop without swapping, and that go with their last mapping. Lazily
// freed pages are not among them.
uint64_t HXChargedPages(const HXMapping &mapping);
// A private mapping that holds pages of its own.
bool HXHoldsOwnPages(const HXMapping &mapping);

// What a region record needs beyond the mapping.
struct HXRegionContext {
    int32_t pid = 0;
    uint64_t ipcNamespace = 0;  // tells System V identifiers of different namespaces apart
    bool reportsCharge = false; // "vm.self_region_heft"
};
// Never 0 or all ones.
uint64_t HXObjectIdentifier(const HXMapping &mapping, const HXRegionContext &context);
vm_region_submap_info_64 HXRegionInfo(const HXMapping &mapping, const HXRegionContext &context);
