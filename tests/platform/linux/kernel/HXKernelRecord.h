// The kernel's record, summed up as the report does, and made-up kernels to read it from.
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
    uint64_t zonesSize() const {
        uint64_t size = 0;
        for (const mach_zone_info &zone : zones)
            size += zone.mzi_cur_size;
        return size;
    }
    uint64_t zonesDirtySize() const {
        uint64_t size = 0;
        for (const mach_zone_info &zone : zones)
            size += zone.mzi_collectable ? zone.mzi_count * zone.mzi_elem_size : zone.mzi_cur_size;
        return size;
    }
    // The sites that are charged to the kernel.
    uint64_t sitesDirtySize() const {
        uint64_t size = 0;
        for (const mach_memory_info_record &site : records)
            if ((site.flags & VM_KERN_SITE_WIRED) && !(site.flags & VM_KERN_SITE_HIDE) && site.site != 24)
                size += site.size;
        return size;
    }
    // The size of the wired site of that type and number; 0 when there is none.
    uint64_t siteSize(uint64_t type, uint64_t number) const {
        for (const mach_memory_info_record &site : records)
            if ((site.flags & ~VM_KERN_SITE_NAMED) == (type | VM_KERN_SITE_WIRED) && site.site == number)
                return site.size;
        return 0;
    }
    uint64_t tagSize(uint64_t tag) const { return siteSize(VM_KERN_SITE_TAG, tag); }
    uint64_t functionSize(const char *function, const char *module = "") const {
        return siteSize(VM_KERN_SITE_KERNEL, HXKernelSiteForFunction(function, module));
    }
    uint64_t moduleSize(const char *name, uint64_t flags = 0) const {
        return siteSize(VM_KERN_SITE_KMOD | flags, HXKernelLoadTagForModule(name));
    }
};

// A machine of some files below proc/ and sys/. Its meminfo has the needed figures, all 0 but MemTotal,
// unless it is given others.
struct HXMadeUpKernel {
    using Files = std::initializer_list<std::pair<std::string, std::string>>;
    HXMadeUpKernel(Files files) {
        const std::string needed =
            "MemTotal: 1000000 kB\nSReclaimable: 0 kB\nSUnreclaim: 0 kB\nKernelStack: 0 kB\n";
        root.write("proc/meminfo", needed);
        for (const auto &[name, text] : files)
            root.write(name, name == "proc/meminfo" ? needed + text : text);
    }
    HXKernelRecord record() { return HXKernelRecord(memory); }

    HXTemporaryFolder root;
    HXLinuxKernelMemory memory{root / "proc", root / "sys", 4096};
};
