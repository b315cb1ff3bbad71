// Fuzz target: any bytes as the kernel's text files, and the record of the kernel that they make.
#include "platform/linux/kernel/HXLinuxKernelAccount.h"

#include <algorithm>
#include <cstdlib>

namespace {

void require(bool holds) {
    if (!holds) std::abort();
}

// Sizes as machines have them: sums of others wrap around.
bool isSane(uint64_t number) {
    return number < uint64_t{1} << 40;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string_view text(reinterpret_cast<const char *>(data), size);
    const auto symbols = HXParseKallsyms(text);
    require(std::is_sorted(symbols.begin(), symbols.end(),
                           [](const auto &a, const auto &b) { return a.address < b.address; }));
    for (const HXAllocationSite &site : HXParseAllocinfo(text))
        require(site.path.data() > text.data() && site.function.data() > site.path.data());
    const auto meminfo = HXParseKernelMeminfo(text);
    if (!meminfo || !isSane(*meminfo->slabUnreclaimableSize) || !isSane(*meminfo->slabReclaimableSize))
        return 0;
    HXLinuxKernelReadings readings{4096,
                                   *meminfo,
                                   HXParseSlabinfo(text),
                                   HXParseVmallocinfo(text),
                                   HXParseModules(text),
                                   HXParseZoneinfo(text),
                                   0,
                                   {}};
    uint64_t cachesSize = 0;
    for (const HXSlabCache &cache : *readings.caches) {
        if (!isSane(cache.slabs) || !isSane(cache.pagesPerSlab * cache.slabs)) return 0;
        cachesSize += cache.slabs * cache.pagesPerSlab * readings.pageSize;
    }
    const HXLinuxKernelAccount account = HXAccountForKernelMemory(readings);
    require(account.zones.size() == account.zoneNames.size());
    uint64_t zonesSize = 0;
    for (const mach_zone_info &zone : account.zones) {
        zonesSize += zone.mzi_cur_size;
        require(!zone.mzi_collectable || zone.mzi_count * zone.mzi_elem_size <= zone.mzi_cur_size);
    }
    require(zonesSize >= cachesSize && zonesSize <= cachesSize + *meminfo->slabUnreclaimableSize);
    for (const mach_memory_info_record &site : account.records)
        require(site.size > 0 && site.mapped == site.size);
    return 0;
}
