// The region-by-region listing.
#include "output/HXOutputFormatterText.h"

#include <charconv>
#include <iterator>

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
    constexpr size_t addressWidth = 16, idWidth = 10, pagesWidth = 7;
    _line.clear();
    const auto number = [this](uint64_t value, size_t width, int base) {
        char digits[64];
        const auto end = std::to_chars(digits, std::end(digits), value, base).ptr;
        const auto length = static_cast<size_t>(end - digits);
        if (length < width) _line.append(width - length, ' ');
        _line.append(digits, length);
    };
    const auto pages = [&](uint64_t size) {
        _line += ' ';
        number((size + pageSize - 1) / pageSize, pagesWidth, 10);
    };
    if (region.start() == kNoAddress) {
        _line += "        unmapped -         unmapped";
    } else {
        number(region.start(), addressWidth, 16);
        _line += " - ";
        number(region.start() + region.size(), addressWidth, 16);
    }
    _line += " [";
    number(region.object_id() & objectIdBits, idWidth, 16);
    _line += ']';
    pages(region.size());
    pages(region.listedSizes().heft());
    if (shows(HXTextSwapped)) pages(region.listedSizes().swapped);
    pages(region.cleanNonSpecSize());
    pages(region.reclaimableSize());
    if (shows(HXTextWired)) pages(region.wiredSize());
    _line.append("   ").append(region.name().str());
    if (const HXString detail = _truncatedNameForString(region.detailedName()))
        _line.append(" ").append(detail.str());
    _line += '\n';
    fwrite(_line.data(), 1, _line.size(), _output);
}
