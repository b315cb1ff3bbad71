// The cases are in tests/cases/linux-maps.txt.
#include "platform/linux/procfs/HXMapsParser.h"

#include "support/HXCaseFile.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <sstream>
#include <utility>

namespace {

std::string told(const HXMapping &mapping, std::string_view path) {
    std::ostringstream line;
    line << std::hex << mapping.start << "-" << mapping.end << " ";
    const char *const flags[] = {"rd", "wr", "ex", "sh", "mr", "mw", "me", "lo", "ht", "dc"};
    for (size_t i = 0; i < std::size(flags); i++)
        if (mapping.has(static_cast<uint16_t>(1 << i))) line << flags[i] << " ";
    line << mapping.offset << " " << mapping.device << " " << std::dec << mapping.inode << " " << path;
    const std::pair<const char *, uint32_t> figures[] = {
        {"resident", mapping.residentPages},  {"anonymous", mapping.anonymousPages},
        {"lazy-free", mapping.lazyFreePages}, {"swapped", mapping.swappedPages},
        {"dirty", mapping.dirtyPages},        {"huge", mapping.hugePages}};
    for (const auto &[name, pages] : figures)
        if (pages != 0) line << " " << name << " " << pages;
    return line.str() + "\n";
}

// Parses `text` in pieces of `piece` bytes, as a reader does.
std::string parsed(const std::string &text, uint32_t pageShift, size_t piece) {
    HXMapsParser parser(pageShift);
    std::string all, kept;
    for (size_t at = 0; at < text.size(); at += std::min(piece, text.size() - at)) {
        kept += text.substr(at, piece);
        std::string_view rest = kept;
        HXMapsEntry entry;
        while (parser.next(&rest, piece >= text.size() - at, &entry))
            all += told(entry.mapping, entry.path);
        kept = std::string(rest);
    }
    return all;
}

TEST(HXMapsParser, ReadsWhatManyKernelsWriteWhereverItIsCut) {
    for (const HXCase &each : HXReadCases("linux-maps.txt")) {
        const auto &[label, expected] = each.expected.at(0);
        const auto shift = static_cast<uint32_t>(std::stoul(label));
        EXPECT_EQ(parsed(each.input, shift, SIZE_MAX), expected) << each.title;
        const std::string unended = each.input.substr(0, each.input.size() - 1);
        EXPECT_EQ(parsed(unended, shift, SIZE_MAX), expected) << each.title;
        for (size_t piece = 1; piece < each.input.size(); piece += 7)
            EXPECT_EQ(parsed(each.input, shift, piece), expected) << each.title << " by " << piece;
    }
}

} // namespace
