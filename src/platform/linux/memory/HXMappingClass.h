// What a mapping's figures, path and file system mean: its class, its charge and its region record. Pure.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/memory/HXFileSystemKind.h"
#include "platform/linux/procfs/HXMapping.h"

#include <cstdint>
#include <string_view>

// The kind of `path` as maps tells it.
HXPathKind HXPathKindOf(std::string_view path);
// NAME of [anon:NAME] and [anon_shmem:NAME]; empty for other paths.
std::string_view HXGivenName(std::string_view path);

// Completes `mapping` (kind, tag, and the flags that classification finds out). `sharedMemoryDevice`: the
// device of the kernel's own tmpfs, on which shared memory without a name lies; a path alone proves nothing,
// since a file may have any. `namedTag`: the user tag of the name that a program gave its memory; 0 when
// there is none.
void HXClassifyMapping(HXPathKind kind, HXFileSystemKind fileSystem, uint32_t sharedMemoryDevice,
                       uint8_t namedTag, HXMapping *mapping);

// Whether a mapping's pages belong to the process alone, and come from no file.
bool HXIsPrivateAnonymous(const HXMapping &mapping);
// Whether a private mapping holds pages of its own.
bool HXHoldsOwnPages(const HXMapping &mapping);

// Whether its process may share pages of its own in the mapping with processes that it was forked from or has
// forked.
bool HXMayShareAfterFork(const HXMapping &mapping);

// The record of a classified mapping. `objectID`: of what it maps (HXObjectIdentifiers.h), below 2^53.
// `reportsCharge`: "vm.self_region_heft".
vm_region_submap_info_64 HXRegionInfo(const HXMapping &mapping, uint64_t objectID, bool reportsCharge);
