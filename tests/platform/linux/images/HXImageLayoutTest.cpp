#include "platform/linux/images/HXImageLayout.h"

#include "support/HXBuilders.h"

#include <gtest/gtest.h>

#include <cstring>
#include <sstream>

namespace {

std::optional<HXElfHeaders> parse(const std::string &bytes) {
    const auto place = HXParseElfFileHeader(bytes);
    if (!place || place->offset > bytes.size()) return std::nullopt;
    return HXParseElfProgramHeaders(std::string_view(bytes).substr(place->offset), *place);
}

// As linkers lay out libraries: symbols, code, constants, data of which the first page is relocated.
const std::string kCorpus = FUZZ_CORPUS "/elf/";
const std::string kLibrary = contentOf(kCorpus + "library");

TEST(HXElfHeaders, AcceptsSenseAlone) {
    const auto headers = parse(kLibrary), narrow = parse(contentOf(kCorpus + "library-32"));
    ASSERT_TRUE(headers && narrow);
    EXPECT_EQ(headers->loads.size(), 4u);
    EXPECT_EQ(headers->relocatedEnd, 0x8000u);
    EXPECT_EQ(narrow->loads.size(), 4u);
    EXPECT_EQ(narrow->loads[3].memorySize, headers->loads[3].memorySize);
    EXPECT_TRUE(headers->loads[3].writable && !headers->loads[3].executable);

    constexpr size_t code = 64 + 56, relocated = 64 + 4 * 56; // program headers (elf(5))
    constexpr size_t flags = 4, address = 16, memorySize = 40;
    const struct {
        size_t position;
        int byte;
        const char *what;
    } senseless[] = {
        {0, 9, "magic"},
        {4, 9, "class"},
        {5, 2, "byte order"},
        {16, 9, "type"},
        {32, 63, "program headers inside the file's header"},
        {39, 9, "program headers far away"},
        {54, 9, "size of a program header"},
        {56, 0, "no program header"},
        {57, 3, "hundreds of program headers"},
        {code + flags, 4, "no code"},
        {code + memorySize + 1, 0x20, "more in the file than in memory"},
        {code + address + 1, 0x10, "overlapping loads"},
        {code + address + 7, 2, "an address that no process has"},
        {code + memorySize + 7, 2, "a size that no process has"},
        {relocated + memorySize + 7, 2, "what is relocated ends nowhere"},
    };
    for (const auto &item : senseless) {
        std::string bad = kLibrary;
        bad[item.position] = static_cast<char>(item.byte);
        EXPECT_FALSE(parse(bad)) << item.what;
    }
    for (size_t length = 0; length < kLibrary.size(); length++)
        EXPECT_FALSE(parse(kLibrary.substr(0, length))) << length;
}

struct Place {
    const char *access;
    uint64_t start, end, offset;
    const char *path = "/lib/x.so";
};

// "NAME START-END" of every segment of every image, an image's base before.
std::string layoutOf(const std::vector<Place> &places, const std::string &file = kLibrary) {
    HXAddressSpace addressSpace;
    for (const Place &place : places) {
        HXMapping mapping;
        HXNamedTags tags;
        mapping.start = place.start;
        mapping.end = place.end;
        mapping.offset = place.offset;
        mapping.inode = mapping.device = place.path[0] == '/' ? 99 : 0;
        mapping.path = addressSpace.intern(place.path, tags);
        mapping.kind = addressSpace.path(mapping.path).kind;
        for (const auto &[letter, flag] : {std::pair('r', HXMappingReadable),
                                           {'w', HXMappingWritable},
                                           {'x', HXMappingExecutable},
                                           {'s', HXMappingShared}})
            if (strchr(place.access, letter)) mapping.flags |= flag;
        addressSpace.append(mapping);
    }
    const auto parsed = parse(file);
    std::ostringstream text;
    text << std::hex;
    for (const auto &image :
         HXFindImages(addressSpace, 0x1000, [&](size_t) { return parsed ? &*parsed : nullptr; })) {
        text << image.baseAddress << ":";
        for (const auto &segment : image.segments)
            text << " " << segment.name << " " << segment.start << "-" << segment.start + segment.length;
        text << "\n";
    }
    return text.str();
}

TEST(HXImageLayout, NamesSegmentsByTheHeaders) {
    const std::vector<Place> loaded = {
        {"r", 0x100000, 0x102000, 0},       {"rx", 0x102000, 0x105000, 0x2000},
        {"r", 0x105000, 0x106000, 0x5000},  {"r", 0x107000, 0x108000, 0x6000},
        {"rw", 0x108000, 0x10a000, 0x7000}, {"rw", 0x10a000, 0x10c000, 0, ""},
    };
    auto twice = loaded;
    twice.push_back({"rw", 0x10c000, 0x10d000, 0, ""}); // behind the image's zero-filled memory
    for (Place place : loaded) {
        place.start += 0x100000;
        place.end += 0x100000;
        twice.push_back(place);
    }
    twice.back().end += 0x5000; // anonymous memory that goes on behind the image's
    const std::string first = "100000: __LINKEDIT 100000-102000 __TEXT 102000-105000 __CONST 105000-106000 "
                              "__DATA_CONST 107000-108000 __DATA 108000-10a000 __BSS 10a000-10c000\n";
    const std::string second = "200000: __LINKEDIT 200000-202000 __TEXT 202000-205000 __CONST 205000-206000 "
                               "__DATA_CONST 207000-208000 __DATA 208000-20a000 __BSS 20a000-20c000\n";
    const struct {
        const char *what;
        std::vector<Place> places;
        std::string expected;
    } cases[] = {
        {"twice", twice, first + second},
        {"not relocated yet, its protection changed for a while, the heap behind it",
         {{"rx", 0x102000, 0x103000, 0x2000},
          {"rwx", 0x103000, 0x104000, 0x3000},
          {"rx", 0x104000, 0x105000, 0x4000},
          {"rw", 0x107000, 0x10a000, 0x6000},
          {"rw", 0x10a000, 0x10b000, 0, "[heap]"}},
         "100000: __TEXT 102000-105000 __DATA 107000-10a000\n"},
        {"the end of the code alone", {{"rx", 0x104000, 0x105000, 0x4000}}, "100000: __TEXT 104000-105000\n"},
        {"the vDSO", {{"rx", 0x7000, 0x9000, 0, "[vdso]"}}, "7000: __TEXT 7000-9000\n"},
        {"all that is readable is executable",
         {{"rx", 0x100000, 0x106000, 0}, {"rwx", 0x400000, 0x401000, 0, "[stack]"}},
         "100000: __TEXT 100000-106000\n"},
        {"the whole file, executable", {{"rx", 0x100000, 0x109000, 0}}, ""},
        {"beyond the code", {{"rx", 0x102000, 0x106000, 0x2000}}, ""},
        {"shared", {{"rxs", 0x102000, 0x105000, 0x2000}}, ""},
        {"the image would begin below address 0", {{"rx", 0x1000, 0x2000, 0x3000}}, ""},
        {"constants, mapped executable", {{"rx", 0x102000, 0x103000, 0x5000}}, ""},
    };
    for (const auto &item : cases)
        EXPECT_EQ(layoutOf(item.places), item.expected) << item.what;
    EXPECT_EQ(layoutOf({{"rx", 0x400000, 0x402000, 0}}, contentOf(kCorpus + "program")),
              "400000: __TEXT 400000-402000\n");
    EXPECT_EQ(layoutOf(loaded, ""), "") << "no image by its headers";
}

} // namespace
