#include "platform/linux/kernel/HXLinuxMachineFigures.h"

#include "platform/linux/kernel/HXLinuxKernelAccount.h"

namespace {

// 0 for a figure that the kernel does not tell.
uint64_t told(std::optional<uint64_t> size) {
    return size.value_or(0);
}

uint64_t difference(uint64_t a, uint64_t b) {
    return a > b ? a - b : 0;
}

// Anonymous pages that no process maps: of the swap cache, and of huge pages that are mapped in part. No
// figure tells them, but the lists of reclaim hold them, beside what is told. Pages that a CPU is about to
// add to the lists (a few for each) are in neither.
uint64_t unmappedAnonymousSize(const HXKernelMeminfo &meminfo) {
    const uint64_t listedSize =
        told(meminfo.activeSize) + told(meminfo.inactiveSize) + told(meminfo.unevictableSize);
    return difference(listedSize,
                      told(meminfo.anonymousSize) + told(meminfo.cachedSize) + told(meminfo.buffersSize));
}

} // namespace

std::vector<HXMachineFigure> HXMachineFigures(const HXLinuxKernelReadings &readings, uint64_t vmallocSize) {
    const HXKernelMeminfo &meminfo = readings.meminfo;
    const HXHugePagePools &huge = readings.hugePages;
    const uint64_t totalSize = told(meminfo.totalSize), sharedSize = told(meminfo.sharedSize),
                   reclaimableSlabSize = told(meminfo.slabReclaimableSize);
    std::vector<HXMachineFigure> figures = {
        {"memory free", told(meminfo.freeSize)},
        {"memory free on CPU lists", readings.zonePages.listed * readings.pageSize},
        {"memory page cache", difference(told(meminfo.cachedSize), sharedSize)},
        {"memory buffers", told(meminfo.buffersSize)},
        {"memory anonymous", told(meminfo.anonymousSize)},
        {"memory anonymous unmapped", unmappedAnonymousSize(meminfo)},
        {"memory shared", sharedSize},
        {"memory huge pages in use", difference(told(meminfo.hugePageSize), huge.freeSize)},
        {"memory huge pages reserved", huge.reservedSize},
        {"memory huge pages free", difference(huge.freeSize, huge.reservedSize)},
        {"memory page tables", told(meminfo.pageTableSize)},
        {"memory secondary page tables", told(meminfo.secondaryPageTableSize)},
        {"memory slab reclaimable", reclaimableSlabSize},
        {"memory slab unreclaimable", told(meminfo.slabUnreclaimableSize)},
        {"memory kernel reclaimable", difference(told(meminfo.reclaimableSize), reclaimableSlabSize)},
        {"memory kernel stacks", told(meminfo.kernelStackSize)},
        {"memory vmalloc", vmallocSize},
        {"memory per-CPU", told(meminfo.perCpuSize)},
        {"memory compressed pool", told(meminfo.zswapSize) + readings.zramSize},
        {"memory corrupted", told(meminfo.hardwareCorruptedSize)},
    };
    uint64_t otherSize = totalSize;
    for (const HXMachineFigure &kind : figures)
        otherSize = difference(otherSize, kind.size);
    figures.push_back({"memory other", otherSize});
    figures.insert(figures.begin(), {"memory total", totalSize});
    figures.push_back({"available memory", told(meminfo.availableSize)});
    const uint64_t swapTotalSize = told(meminfo.swapTotalSize);
    figures.push_back({"swap total", swapTotalSize});
    figures.push_back(
        {"swap in use", difference(swapTotalSize, meminfo.swapFreeSize.value_or(swapTotalSize))});
    figures.push_back({"swap cache", told(meminfo.swapCachedSize)});
    return figures;
}
