#include "platform/linux/images/HXImageLayout.h"

#include "platform/linux/procfs/HXMapsParser.h"
#include "support/HXBuilders.h"
#include "support/HXCaseFile.h"

#include <gtest/gtest.h>

#include <sstream>

namespace {

std::optional<HXElfHeaders> parse(const std::string &bytes) {
    const auto place = HXParseElfFileHeader(bytes);
    if (!place || place->offset > bytes.size()) return std::nullopt;
    return HXParseElfProgramHeaders(std::string_view(bytes).substr(place->offset), *place);
}

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

// "NAME START-END" of every segment of every image, an image's base before.
std::string layoutOf(std::string_view maps, const std::optional<HXElfHeaders> &headers) {
    HXAddressSpace addressSpace;
    HXNamedTags tags;
    HXMapsParser parser(12);
    for (HXMapsEntry entry; parser.next(&maps, true, &entry);) {
        entry.mapping.path = addressSpace.intern(entry.path, tags);
        entry.mapping.kind = addressSpace.path(entry.mapping.path).kind;
        addressSpace.append(entry.mapping);
    }
    std::ostringstream text;
    text << std::hex;
    for (const auto &image :
         HXFindImages(addressSpace, 0x1000, [&](size_t) { return headers ? &*headers : nullptr; })) {
        text << image.baseAddress << ":";
        for (const auto &segment : image.segments)
            text << " " << segment.name << " " << segment.start << "-" << segment.start + segment.length;
        text << "\n";
    }
    return text.str();
}

TEST(HXImageLayout, NamesSegmentsByTheHeaders) {
    for (const HXCase &each : HXReadCases("linux-images.txt")) {
        const std::string file = each.title.substr(0, each.title.find(':'));
        EXPECT_EQ(layoutOf(each.input, parse(contentOf(kCorpus + file))), each.expected.at(0).text)
            << each.title;
    }
}

} // namespace
