// Fuzz target: any bytes as an ELF file, and the image that it makes where it is loaded as its headers say.
#include "platform/linux/images/HXImageLayout.h"

#include <cstdlib>
#include <set>

namespace {

constexpr uint64_t kPage = 4096, kBase = uint64_t{1} << 40;

void require(bool holds) {
    if (!holds) std::abort();
}

// Appends a mapping of the file for each load, one behind the other.
void load(const HXElfHeaders &headers, HXAddressSpace &addressSpace) {
    for (const HXElfLoad &load : headers.loads) {
        HXMapping mapping{.inode = 1, .kind = HXPathKind::file};
        mapping.start = kBase + load.address / kPage * kPage;
        mapping.end = kBase + (load.address + load.fileSize + kPage - 1) / kPage * kPage;
        mapping.offset = load.offset / kPage * kPage;
        mapping.flags = load.executable ? HXMappingReadable | HXMappingExecutable : HXMappingReadable;
        if (mapping.end > mapping.start) addressSpace.append(mapping);
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    const std::string_view bytes(reinterpret_cast<const char *>(data), size);
    const auto place = HXParseElfFileHeader(bytes);
    if (!place || place->offset > size) return 0;
    const auto headers = HXParseElfProgramHeaders(bytes.substr(place->offset), *place);
    if (!headers) return 0;
    require(place->size() <= size - place->offset);
    uint64_t end = 0, last = 0;
    bool isExecutable = false;
    for (const HXElfLoad &load : headers->loads) {
        require(load.address >= end && load.fileSize <= load.memorySize && load.memorySize > 0);
        end = load.address + load.memorySize;
        isExecutable |= load.executable;
    }
    require(isExecutable && headers->relocatedStart <= headers->relocatedEnd);
    const std::set<std::string_view> names = {"__TEXT",       "__LINKEDIT", "__CONST",
                                              "__DATA_CONST", "__DATA",     "__BSS"};
    HXAddressSpace addressSpace;
    load(*headers, addressSpace);
    for (const auto &image : HXFindImages(addressSpace, kPage, [&](size_t) { return &*headers; })) {
        for (const RVRegion &segment : image.segments) {
            require(names.contains(segment.name) && segment.length > 0 && segment.start >= last);
            last = segment.start + segment.length;
        }
        require(last <= addressSpace[addressSpace.count() - 1].end);
    }
    return 0;
}
