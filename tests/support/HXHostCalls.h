// Calls of a host that tests make often, their answers as text: what was found, all numbers hexadecimal, or
// the error's name.
#pragma once

#include "platform/HXPlatform.h"

#include <string>

// A port to a task that there is.
mach_port_t HXTaskOf(HXPlatform &host, int32_t pid);
// "START+SIZE" of the first region that ends above `address`, by mach_vm_region_recurse, which fills
// `info`; by mach_vm_region when there is none to fill.
std::string HXRegionAt(HXPlatform &host, mach_port_t task, uint64_t address, vm_region_submap_info_64 *info,
                       uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64);
// The dispositions of the pages of [address, address + bytes), by as many queries as the host wants.
std::string HXPagesAt(HXPlatform &host, mach_port_t task, uint64_t address, uint64_t bytes);
