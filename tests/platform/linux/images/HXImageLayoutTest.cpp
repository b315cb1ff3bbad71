#include "platform/linux/images/HXImageLayout.h"
#include "platform/linux/images/HXElfHeaders.h"

#include <elf.h>
#include <gtest/gtest.h>

#include <cstring>
#include <sstream>

namespace {

struct Header {
    uint32_t type;
    uint32_t flags;
    uint64_t offset, address, fileSize, memorySize;
};

// The bytes of an ELF file of that word size with those program headers.
template <typename FileHeader, typename ProgramHeader>
std::string elfFile(uint8_t wordClass, const std::vector<Header> &headers) {
    FileHeader file{};
    std::memcpy(file.e_ident, ELFMAG, SELFMAG);
    file.e_ident[EI_CLASS] = wordClass;
    file.e_ident[EI_DATA] = ELFDATA2LSB;
    file.e_type = ET_DYN;
    file.e_phoff = sizeof file;
    file.e_phentsize = sizeof(ProgramHeader);
    file.e_phnum = static_cast<uint16_t>(headers.size());
    std::string bytes(reinterpret_cast<const char *>(&file), sizeof file);
    for (const Header &header : headers) {
        ProgramHeader program{};
        program.p_type = header.type;
        program.p_flags = header.flags;
        program.p_offset = static_cast<decltype(program.p_offset)>(header.offset);
        program.p_vaddr = static_cast<decltype(program.p_vaddr)>(header.address);
        program.p_filesz = static_cast<decltype(program.p_filesz)>(header.fileSize);
        program.p_memsz = static_cast<decltype(program.p_memsz)>(header.memorySize);
        bytes.append(reinterpret_cast<const char *>(&program), sizeof program);
    }
    return bytes;
}
std::string wide(const std::vector<Header> &headers) {
    return elfFile<Elf64_Ehdr, Elf64_Phdr>(ELFCLASS64, headers);
}

std::optional<HXElfHeaders> parse(const std::string &bytes) {
    const auto place = HXParseElfFileHeader(bytes);
    if (!place || place->offset > bytes.size()) return std::nullopt;
    return HXParseElfProgramHeaders(std::string_view(bytes).substr(place->offset), *place);
}

// As linkers lay out libraries: symbols, code, constants, data of which the first page is relocated.
const std::vector<Header> library = {
    {PT_LOAD, PF_R, 0, 0, 0x1800, 0x1800},
    {PT_LOAD, PF_R | PF_X, 0x2000, 0x2000, 0x2f00, 0x2f00},
    {PT_LOAD, PF_R, 0x5000, 0x5000, 0x1000, 0x1000},
    {PT_LOAD, PF_R | PF_W, 0x6d00, 0x7d00, 0x1400, 0x3400},
    {PT_GNU_RELRO, PF_R, 0x6d00, 0x7d00, 0x300, 0x300},
    {PT_NOTE, PF_R, 0x300, 0x300, 0x20, 0x20},
};

TEST(HXElfHeaders, AcceptsSenseAlone) {
    const auto headers = parse(wide(library));
    ASSERT_TRUE(headers);
    EXPECT_EQ(headers->loads.size(), 4u);
    EXPECT_EQ(headers->relocatedEnd, 0x8000u);
    EXPECT_EQ((parse(elfFile<Elf32_Ehdr, Elf32_Phdr>(ELFCLASS32, library))->loads.size()), 4u);

    const Header code{PT_LOAD, PF_X, 0, 0, 0x1000, 0x1000};
    const std::vector<std::vector<Header>> senseless = {
        {},
        {{PT_LOAD, PF_R, 0, 0, 0x1000, 0x1000}},                  // no code
        {{PT_LOAD, PF_X, 0, 0, 0x2000, 0x1000}},                  // more in the file than in memory
        {{PT_LOAD, PF_X, 0, UINT64_MAX - 0xfff, 0x1000, 0x2000}}, // wraps around
        {{PT_LOAD, PF_X, UINT64_MAX, 0, 0x1000, 0x1000}},
        {code, code},                                       // overlap
        {{PT_LOAD, PF_R, 0, 0x8000, 0x1000, 0x1000}, code}, // descend
        {code, {PT_GNU_RELRO, PF_R, 0, UINT64_MAX, 1, UINT64_MAX}},
        std::vector<Header>(513, code),
    };
    for (size_t i = 0; i < senseless.size(); i++)
        EXPECT_FALSE(parse(wide(senseless[i]))) << i;
    const std::string good = wide(library);
    for (size_t length = 0; length < good.size(); length++)
        EXPECT_FALSE(parse(good.substr(0, length))) << length;
    for (const size_t position : {0, EI_CLASS, EI_DATA, 16, 54}) { // up to the type and the headers' size
        std::string bad = good;
        bad[position] = 9;
        EXPECT_FALSE(parse(bad)) << position;
    }
}

struct Place {
    const char *access;
    uint64_t start, end, offset;
    const char *path = "/lib/x.so";
};

// "NAME START-END" of every segment of every image, an image's base before.
std::string layoutOf(const std::vector<Place> &places, const std::vector<Header> &headers = library) {
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
    const auto parsed = parse(wide(headers));
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
    EXPECT_EQ(layoutOf(loaded, {}), "") << "no image by its headers";
}

} // namespace
