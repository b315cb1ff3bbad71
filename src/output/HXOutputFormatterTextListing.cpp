// The region-by-region listing.
#include "output/HXOutputFormatterText.h"

#include <cinttypes>

void HXOutputFormatterText::printAtlasLikeOutputForProcess(const HXProcess &process,
                                                           const HXMemoryRegionList &regions) {
    const auto optional = [this](int32_t option, const char *text) { return shows(option) ? text : ""; };
    fprintf(_output, "%s\n\n", process.displayString().c_str());
    fprintf(_output,
            "           start                end  [objectid]      VRT     DRT%s     CLN     RCL%s   tag "
            "(detail)\n",
            optional(HXTextSwapped, "     SWP"), optional(HXTextWired, "    WIRE"));
    fprintf(_output,
            "      ----------         ----------  ----------    -----   -----%s   -----   -----%s   "
            "------------\n",
            optional(HXTextSwapped, "   -----"), optional(HXTextWired, "   -----"));
    for (const HXMemoryRegion &region : regions)
        if (!region.isPart()) printRegion(region, process.pageSize());
    fputc('\n', _output);
}

void HXOutputFormatterText::printRegion(const HXMemoryRegion &region, uint64_t pageSize) {
    constexpr uint64_t objectIdBits = 0xFFFFFFFFFF; // the low 40
    const auto pages = [pageSize](uint64_t size) { return (size + pageSize - 1) / pageSize; };
    const uint64_t id = region.object_id() & objectIdBits;
    if (region.start() == kNoAddress)
        fprintf(_output, "        unmapped -         unmapped [%10" PRIx64 "]", id);
    else
        fprintf(_output, "%16" PRIx64 " - %16" PRIx64 " [%10" PRIx64 "]", region.start(),
                region.start() + region.size(), id);
    fprintf(_output, " %7" PRIu64 " %7" PRIu64, pages(region.size()), pages(region.listedSizes().heft()));
    if (shows(HXTextSwapped)) fprintf(_output, " %7" PRIu64, pages(region.listedSizes().swapped));
    fprintf(_output, " %7" PRIu64 " %7" PRIu64, pages(region.cleanNonSpecSize()),
            pages(region.reclaimableSize()));
    if (shows(HXTextWired)) fprintf(_output, " %7" PRIu64, pages(region.wiredSize()));
    fprintf(_output, "   %s", region.name().c_str());
    if (const HXString detail = _truncatedNameForString(region.detailedName()))
        fprintf(_output, " %s", detail.c_str());
    fputc('\n', _output);
}
