// Turns what the kernel reports of its memory in several files, which overlap, into one record of zones and
// sites that counts every page once. Touches no system.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/kernel/HXLinuxKernelText.h"

#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

// The pools of huge pages of all sizes together, in bytes (the kernel's document on hugetlbpage).
struct HXHugePagePools {
    uint64_t freeSize = 0;
    uint64_t reservedSize = 0; // of the free ones: promised to mappings that have not touched them yet
};

// What was read. The text that the views point into belongs to the caller.
struct HXLinuxKernelReadings {
    uint64_t pageSize = 4096;
    HXKernelMeminfo meminfo;
    // None where the kernel has no such file: the slabs are then known from meminfo alone.
    std::optional<std::vector<HXSlabCache>> caches;
    std::vector<HXVmallocArea> areas;
    std::vector<HXKernelModule> modules;
    HXZonePages zonePages;
    uint64_t zramSize = 0; // bytes that zram devices hold
    HXHugePagePools hugePages;
};

struct HXLinuxKernelAccount {
    std::vector<mach_zone_name> zoneNames;
    std::vector<mach_zone_info> zones; // as many as names
    std::vector<mach_memory_info_record> records;
};

// Zones: the slab caches that hold memory. Their dirty bytes (current size, or count times element size when
// collectable) add up to SUnreclaim, the rest to SReclaimable; what the kernel counts as unreclaimable slab
// but keeps in no cache, allocations of more than two pages, is the zone "kmalloc-large".
//
// Sites: kernel stacks, per-CPU data, the compressed pool, modules and the areas of vmalloc by the function
// that asked for them, wired; page tables hidden, since the processes are charged for them; locked user
// memory. The wired sites that are neither hidden nor locked user memory add up to the pages of all vmalloc
// areas, kernel stacks that are not among these, Percpu and the compressed pool.
//
// Counters: those with published numbers, and by name what the machine counts (HXMachineFigures). They are
// no part of the sums above.
HXLinuxKernelAccount HXAccountForKernelMemory(const HXLinuxKernelReadings &readings);

// The site of a kernel function that is known by its name alone, the same in every run: below 2^53, like all
// sites, and above those of addresses.
uint64_t HXKernelSiteForFunction(std::string_view function, std::string_view module);

// The load tag of a module, the same in every run and never 0; 32 bits.
uint64_t HXKernelLoadTagForModule(std::string_view name);
