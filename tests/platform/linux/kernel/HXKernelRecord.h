// The kernel's record as a test looks at it.
#pragma once

#include "platform/linux/kernel/HXLinuxKernelAccount.h"
#include "platform/linux/kernel/HXLinuxKernelMemory.h"

struct HXKernelRecord : HXLinuxKernelAccount {
    kern_return_t error = KERN_SUCCESS;

    // What is handed out is given back.
    explicit HXKernelRecord(HXLinuxKernelMemory &memory) {
        mach_zone_name *names = nullptr;
        mach_zone_info *infos = nullptr;
        mach_memory_info_record *sites = nullptr;
        uint32_t nameCount = 0, zoneCount = 0, siteCount = 0;
        error = memory.mach_memory_info(0, &names, &nameCount, &infos, &zoneCount, &sites, &siteCount);
        zoneNames.assign(names, names + nameCount);
        zones.assign(infos, infos + zoneCount);
        records.assign(sites, sites + siteCount);
        memory.vm_deallocate(0, names, nameCount * sizeof *names);
        memory.vm_deallocate(0, infos, zoneCount * sizeof *infos);
        memory.vm_deallocate(0, sites, siteCount * sizeof *sites);
    }
    // As the report counts it.
    static uint64_t dirtySize(const mach_zone_info &zone) {
        return zone.mzi_collectable ? zone.mzi_count * zone.mzi_elem_size : zone.mzi_cur_size;
    }
};
