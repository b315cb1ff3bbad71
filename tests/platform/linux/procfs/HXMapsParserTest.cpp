#include "platform/linux/procfs/HXMapsParser.h"

#include "platform/linux/procfs/HXProcText.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace {

struct Parsed {
    HXMapping mapping;
    std::string path;
    bool operator==(const Parsed &other) const {
        const auto all = [](const Parsed &p) {
            const HXMapping &m = p.mapping;
            return std::tuple(m.start, m.end, m.offset, m.inode, m.device, m.residentPages, m.anonymousPages,
                              m.lazyFreePages, m.swappedPages, m.dirtyPages, m.hugePages, m.flags, p.path);
        };
        return all(*this) == all(other);
    }
};

// Parses `text` in pieces of `piece` bytes, as a reader does.
std::vector<Parsed> parse(const std::string &text, size_t piece = SIZE_MAX, uint32_t pageShift = 12) {
    HXMapsParser parser(pageShift);
    std::vector<Parsed> parsed;
    std::string kept;
    for (size_t at = 0; at < text.size();) {
        const size_t length = std::min(piece, text.size() - at);
        kept += text.substr(at, length);
        at += length;
        std::string_view rest = kept;
        HXMapsEntry entry;
        while (parser.next(&rest, at == text.size(), &entry))
            parsed.push_back({entry.mapping, std::string(entry.path)});
        kept = std::string(rest);
    }
    return parsed;
}

// A mapping's text as kernel 6.18 writes it, up to fields that nobody reads.
std::string modern(const std::string &header, uint64_t rss, uint64_t anonymous, uint64_t lazy, uint64_t swap,
                   uint64_t huge, const std::string &flags) {
    std::string text = header + "\n";
    const std::pair<const char *, uint64_t> fields[] = {{"Size:", 1024},           {"Rss:", rss},
                                                        {"Pss_Dirty:", rss},       {"Shared_Dirty:", 8},
                                                        {"Private_Dirty:", 12},    {"Anonymous:", anonymous},
                                                        {"LazyFree:", lazy},       {"AnonHugePages:", 2048},
                                                        {"Shared_Hugetlb:", huge}, {"Private_Hugetlb:", huge},
                                                        {"Swap:", swap},           {"SwapPss:", swap}};
    for (const auto &[label, kilobytes] : fields) {
        char line[64];
        snprintf(line, sizeof line, "%-16s%8lu kB\n", label, static_cast<unsigned long>(kilobytes));
        text += line;
    }
    return text + "THPeligible:           0\nVmFlags: " + flags + " \n";
}

const std::string sample =
    modern("00400000-00452000 r-xp 00001000 fe:0a 1835 /usr/bin/dbus daemon (deleted)", 328, 16, 4, 40, 0,
           "rd ex mr mw me lo") +
    modern("7f0000000000-7f0000200000 rw-s 00000000 00:0f 70000000000 /anon_hugepage (deleted)", 0, 0, 0, 0,
           1024, "rd wr sh mr mw me ms ht dc") +
    // A number that outgrows its column moves all that follows.
    modern("7f1000000000-7fff00000000 ---p 00000000 00:00 0 ", 123456789012, 123456789012, 0, 0, 0,
           "mr mw me") +
    modern("7fff00000000-7fff00021000 rw-p 00000000 00:00 0                          [stack]", 12, 12, 0, 0,
           0, "rd wr mr mw me gd");

constexpr uint16_t may = HXMappingMayRead | HXMappingMayWrite | HXMappingMayExecute;

TEST(HXMapsParser, ReadsSmapsWhereverItIsCut) {
    const auto whole = parse(sample);
    ASSERT_EQ(whole.size(), 4u);
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
                                          HXMappingHugePages | HXMappingNotInherited | may);
    EXPECT_EQ(whole[2].mapping.residentPages, UINT32_MAX);
    EXPECT_EQ(whole[3].path, "[stack]");
    for (size_t piece = 1; piece < 1500; piece += 7)
        EXPECT_EQ(parse(sample, piece), whole) << piece;
    EXPECT_EQ(parse(sample, SIZE_MAX, 16)[0].mapping.residentPages, 5u) << "pages of 64 KiB";
}

TEST(HXMapsParser, ReadsOtherKernelsAndDamagedText) {
    const std::string header = "08048000-08056000 r-xp 00000000 03:0c 64593      /usr/sbin/gpm\n";
    // Kernel 2.6: no flags, no swap; an unknown field; a field without a number.
    const std::string old = header +
                            "Size:                56 kB\nRss:                  8 kB\nFancy:      7 kB\n"
                            "Swap:           none\nReferenced:           4 kB\n";
    const auto two = parse(old + "08056000-08057000 rw-p 0000d000 03:0c 64593\nRss:                  4 kB\n");
    ASSERT_EQ(two.size(), 2u);
    EXPECT_EQ(two[0].mapping.residentPages, 2u);
    EXPECT_EQ(two[0].mapping.flags, HXMappingReadable | HXMappingExecutable | may);
    EXPECT_EQ(two[1].mapping.residentPages, 1u);
    EXPECT_EQ(parse(header + header).size(), 2u) << "maps alone";
    EXPECT_EQ(parse(header.substr(0, header.size() - 1))[0].path, "/usr/sbin/gpm") << "no newline at the end";
    for (const std::string bad :
         {"", "\n", "nonsense\n", "5000-4000 r-xp 0 0:0 0\n", "1000-2000\n", "1000-2000 r\n",
          "1000-2000 rwxp 0 00:00\n", "10000000000000000-20000000000000000 r-xp 0 0:0 0\n",
          "Rss:        8 kB\n"}) {
        const auto parsed = parse(bad + header);
        ASSERT_EQ(parsed.size(), 1u) << bad;
        EXPECT_EQ(parsed[0].path, "/usr/sbin/gpm") << bad;
    }
}

} // namespace
