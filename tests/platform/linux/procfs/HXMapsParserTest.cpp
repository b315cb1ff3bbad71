#include "platform/linux/procfs/HXMapsParser.h"

#include "platform/linux/procfs/HXProcText.h"

#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

namespace {

constexpr uint16_t may = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;

struct Parsed {
    HXMapping mapping;
    std::string path;
    bool operator==(const Parsed &other) const {
        return std::memcmp(&mapping, &other.mapping, sizeof mapping) == 0 && path == other.path;
    }
};

// Parses `text` in pieces of `piece` bytes, as a reader does.
std::vector<Parsed> parse(const std::string &text, size_t piece = SIZE_MAX, uint32_t pageShift = 12) {
    HXMapsParser parser(pageShift);
    std::vector<Parsed> parsed;
    std::string kept;
    for (size_t at = 0; at < text.size(); at += std::min(piece, text.size() - at)) {
        kept += text.substr(at, piece);
        std::string_view rest = kept;
        HXMapsEntry entry;
        while (parser.next(&rest, piece >= text.size() - at, &entry))
            parsed.push_back({entry.mapping, std::string(entry.path)});
        kept = std::string(rest);
    }
    return parsed;
}

// A mapping's text as kernel 6.18 writes it, but for most of the fields that nobody reads.
std::string modern(const std::string &header, const std::vector<uint64_t> &kilobytes,
                   const std::string &flags) {
    static const char *const labels[] = {"Size:",      "Rss:",      "Shared_Dirty:",    "Private_Dirty:",
                                         "Anonymous:", "LazyFree:", "Private_Hugetlb:", "Swap:"};
    std::string text = header + "\n";
    for (size_t i = 0; i < std::size(labels); i++) {
        char line[64];
        snprintf(line, sizeof line, "%-16s%8lu kB\n", labels[i], static_cast<unsigned long>(kilobytes[i]));
        text += line;
    }
    return text + "THPeligible:           0\nVmFlags: " + flags + " \n";
}

const std::string sample =
    modern("00400000-00452000 r-xp 00001000 fe:0a 1835 /usr/bin/dbus daemon (deleted)",
           {328, 328, 8, 12, 16, 4, 0, 40}, "rd ex mr mw me lo") +
    modern("7f0000000000-7f0000200000 rw-s 00000000 00:0f 70000000000 /anon_hugepage (deleted)",
           {2048, 0, 0, 0, 0, 0, 2048, 0}, "rd wr sh mr ms ht dc") +
    // A number that outgrows its column moves all that follows.
    modern("7f1000000000-7fff00000000 ---p 00000000 00:00 0 ", {0, 123456789012, 0, 0, 4, 0, 0, 0}, "mw me") +
    modern("7fff00000000-7fff00021000 rw-p 00000000 00:00 0                          [stack]",
           {132, 12, 0, 0, 12, 0, 0, 0}, "rd wr mr mw me gd") +
    "ffffffffff600000-ffffffffff601000 --xp 00000000 00:00 0 [vsyscall]\n";

TEST(HXMapsParser, ReadsSmapsWhereverItIsCut) {
    const auto whole = parse(sample);
    ASSERT_EQ(whole.size(), 5u);
    const HXMapping &code = whole[0].mapping;
    EXPECT_EQ((std::vector<uint64_t>{code.start, code.end, code.offset, code.device, code.inode}),
              (std::vector<uint64_t>{0x400000, 0x452000, 0x1000, HXDeviceNumber(0xfe, 0x0a), 1835}));
    EXPECT_EQ((std::vector<uint32_t>{code.residentPages, code.anonymousPages, code.lazyFreePages,
                                     code.swappedPages, code.dirtyPages}),
              (std::vector<uint32_t>{82, 4, 1, 10, 5}));
    EXPECT_EQ(whole[0].path, "/usr/bin/dbus daemon (deleted)");
    EXPECT_EQ(code.flags, HXMappingReadable | HXMappingExecutable | HXMappingLocked | may);
    EXPECT_EQ(whole[1].mapping.hugePages, 512u);
    EXPECT_EQ(whole[1].mapping.flags, HXMappingReadable | HXMappingWritable | HXMappingShared |
                                          HXMappingHugePages | HXMappingNotInherited | HXMappingMayRead);
    EXPECT_EQ(whole[2].mapping.residentPages, UINT32_MAX);
    EXPECT_EQ(whole[3].path, "[stack]");
    for (size_t piece = 1; piece < 1500; piece += 7)
        EXPECT_EQ(parse(sample, piece), whole) << piece;
    EXPECT_EQ(parse(sample, SIZE_MAX, 16)[0].mapping.residentPages, 5u) << "pages of 64 KiB";
}

TEST(HXMapsParser, ReadsOtherKernelsAndDamagedText) {
    const std::string header = "08048000-08056000 r-xp 00000000 03:0c 64593      /usr/sbin/gpm\n";
    const struct {
        const char *title;
        std::string text;
        std::vector<uint32_t> residentPages; // of each mapping
    } cases[] = {
        {"kernel 2.6, an unknown field, one without a number",
         header + "Rss:                  8 kB\nFancy:      7 kB\nSwap:           none\n" + header +
             "Rss:                  4 kB\n",
         {2, 1}},
        {"maps alone", header + header, {0, 0}},
        {"no newline at the end", header.substr(0, header.size() - 1), {0}},
        {"more fields than there are",
         [&] {
             std::string text = header;
             for (int i = 0; i < 12; i++)
                 text += "Rss:                   4 kB\n";
             return text + "VmFlags: rd\n" + text + "VmFlags: rd\n";
         }(),
         {12, 12}},
        {"another order of fields",
         header + "Rss:                   4 kB\nSwap:                  8 kB\nVmFlags: rd\n" + header +
             "Swap:                 12 kB\nRss:                  16 kB\nVmFlags: rd\n",
         {1, 4}},
    };
    for (const auto &c : cases) {
        std::vector<uint32_t> residentPages;
        for (const Parsed &parsed : parse(c.text)) {
            residentPages.push_back(parsed.mapping.residentPages);
            EXPECT_EQ(parsed.path, "/usr/sbin/gpm") << c.title;
        }
        EXPECT_EQ(residentPages, c.residentPages) << c.title;
    }
    for (const std::string bad :
         {"", "\n", "nonsense\n", "5000-4000 r-xp 0 0:0 0\n", "4000-4000 r-xp 0 0:0 0\n", "1000-2000\n",
          "1000-2000 r\n", "1000-2000 rwxp 0 00:00\n", "1000-2000 rwxp 0 00 0 0\n", "Rss:        8 kB\n",
          "10000000000000000-20000000000000000 r-xp 0 0:0 0\n"})
        EXPECT_EQ(parse(bad + header).size(), 1u) << bad;
    EXPECT_EQ(parse(header)[0].mapping.flags, HXMappingReadable | HXMappingExecutable | may);
}

} // namespace
