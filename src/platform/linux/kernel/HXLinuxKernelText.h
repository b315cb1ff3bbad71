// Parsers of the kernel's own reports on its memory. They take the text of a file under /proc and give
// records; lines that do not have the expected form are passed over, for the kernel's formats grow by lines
// and words. Every `std::string_view` in a record points into the text that was parsed. Names are as the
// kernel wrote them, not yet made safe.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

// One cache of /proc/slabinfo, version 2.x (slabinfo(5)).
struct HXSlabCache {
    std::string_view name;
    uint64_t activeObjects{};
    uint64_t objectSize{}; // bytes
    uint64_t slabs{};
    uint64_t pagesPerSlab{};
    // Whether the kernel accounts its slabs as SReclaimable; none where sysfs does not tell. Not in slabinfo.
    std::optional<bool> reclaimable;
};
std::vector<HXSlabCache> HXParseSlabinfo(std::string_view text);

// One area of /proc/vmallocinfo that has pages of its own. Areas without `pages=` map memory that is counted
// elsewhere or is none: device memory (`ioremap`), the pages of others (`vmap` without pages, `vm_map_ram`),
// per-CPU space (`pcpu_get_vm_areas`, counted as Percpu), and freed areas that are not yet unmapped
// (`unpurged`).
struct HXVmallocArea {
    std::string_view function; // the caller's symbol without its offset; empty when it is not named
    std::string_view module;   // the module the caller lies in; empty for the kernel proper
    uint64_t callerAddress{};  // when the caller is no symbol: its address
    uint64_t pages{};
};
std::vector<HXVmallocArea> HXParseVmallocinfo(std::string_view text);

// One module of /proc/modules.
struct HXKernelModule {
    std::string_view name;
    uint64_t size = 0; // bytes of code and data, without what is freed after initialisation
};
std::vector<HXKernelModule> HXParseModules(std::string_view text);

// The figures of /proc/meminfo that describe the machine's memory and the kernel's, in bytes (proc(5)).
struct HXKernelMeminfo {
    // Needed: every kernel since 2.6.32 has them.
    std::optional<uint64_t> totalSize, slabReclaimableSize, slabUnreclaimableSize, kernelStackSize;
    // None for those that this kernel lacks.
    std::optional<uint64_t> pageTableSize;
    std::optional<uint64_t> secondaryPageTableSize; // of virtual machines (since 6.1)
    std::optional<uint64_t> vmallocUsedSize;        // 0 before 5.3, which did not count it
    std::optional<uint64_t> perCpuSize;             // since 4.20
    std::optional<uint64_t> mlockedSize;
    std::optional<uint64_t> zswapSize; // the pool's pages (since 5.19)
    std::optional<uint64_t> hardwareCorruptedSize;
    std::optional<uint64_t> balloonSize; // since 6.15
    std::optional<uint64_t> freeSize, buffersSize;
    std::optional<uint64_t>
        availableSize;                  // the kernel's estimate of what programs could still get (since 3.14)
    std::optional<uint64_t> cachedSize; // page cache, shared memory with it; without buffers and swap cache
    std::optional<uint64_t> sharedSize; // shared memory and tmpfs, resident
    std::optional<uint64_t> anonymousSize;   // mapped anonymous pages
    std::optional<uint64_t> reclaimableSize; // SReclaimable and what else the kernel gives back (since 4.20)
    // What the lists of reclaim hold: all anonymous, shared and file pages, whether or not they are mapped.
    std::optional<uint64_t> activeSize, inactiveSize, unevictableSize;
    std::optional<uint64_t> hugePageSize; // the pools of huge pages of all sizes (since 4.19)
    std::optional<uint64_t> swapTotalSize, swapFreeSize, swapCachedSize;
};
// None when the text lacks a needed figure.
std::optional<HXKernelMeminfo> HXParseKernelMeminfo(std::string_view text);

// The figures of /proc/zoneinfo, added up over all zones.
struct HXZonePages {
    uint64_t present = 0; // pages of RAM that the kernel found, whether or not it manages them
    uint64_t listed = 0;  // free pages on the lists of single CPUs, which MemFree leaves out
};
HXZonePages HXParseZoneinfo(std::string_view text);

// Bytes that a zram device holds (`mem_used_total` of its mm_stat); none when there is no such figure.
std::optional<uint64_t> HXParseZramUsedSize(std::string_view text);

// One allocation site of /proc/allocinfo (kernels with memory allocation profiling, since 6.10).
struct HXAllocationSite {
    uint64_t size{}; // bytes
    std::string_view path;
    int32_t line{};
    std::string_view module; // empty for the kernel proper
    std::string_view function;
};
std::vector<HXAllocationSite> HXParseAllocinfo(std::string_view text);

// One symbol of /proc/kallsyms.
struct HXKernelSymbol {
    uint64_t address{};
    std::string_view name;
    std::string_view module; // empty for the kernel proper
    bool isCode{};
};
// All symbols, by ascending address; several at one address in the order of the file, whose first is the one
// that the kernel itself names the address by. Empty when the kernel hides its addresses by showing zeros.
std::vector<HXKernelSymbol> HXParseKallsyms(std::string_view text);
