// The kernel's record as a test looks at it, and made-up kernels to read it from.
#pragma once

#include "platform/linux/kernel/HXLinuxKernelAccount.h"
#include "platform/linux/kernel/HXLinuxKernelMemory.h"
#include "support/HXTemporaryFolder.h"

#include <initializer_list>
#include <string>
#include <utility>

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

// A machine of some files below proc/ and sys/. Its meminfo has the needed figures, all 0 but MemTotal,
// before those that it is given.
struct HXMadeUpKernel {
    HXMadeUpKernel(std::initializer_list<std::pair<std::string, std::string>> files) {
        const std::string needed =
            "MemTotal: 1 kB\nSReclaimable: 0 kB\nSUnreclaim: 0 kB\nKernelStack: 0 kB\n";
        root.write("proc/meminfo", needed);
        for (const auto &[name, text] : files)
            root.write(name, name == "proc/meminfo" ? needed + text : text);
    }
    HXKernelRecord record() { return HXKernelRecord(memory); }

    HXTemporaryFolder root;
    HXLinuxKernelMemory memory{root / "proc", root / "sys", 4096};
};
