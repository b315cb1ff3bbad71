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

    const auto parsed = [](const std::string &question) {
        std::istringstream words(question);
        size_t position = 0;
        int byte = 0;
        words >> position >> byte;
        std::string bad = kLibrary;
        bad.at(position) = static_cast<char>(byte);
        return parse(bad) ? "accepted" : "refused";
    };
    for (const HXCase &each : HXReadCases("linux-elf.txt"))
        EXPECT_EQ(HXAnswered(each.input, parsed), each.input);
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
