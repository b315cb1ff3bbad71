// Finds the loaded images in an address space by the program headers of the files that it maps. Pure.
#pragma once

#include "platform/HXHostRecords.h"
#include "platform/linux/images/HXElfHeaders.h"
#include "platform/linux/memory/HXAddressSpace.h"

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

struct HXLoadedImage {
    std::string path;
    uint64_t baseAddress;
    std::vector<RVRegion> segments; // ascending, not overlapping; their names live for ever
};

// The headers of the file that a mapping (by its index) maps; null when it is no image. They live on.
using HXHeadersOfMapping = std::function<const HXElfHeaders *(size_t index)>;

// The images, ascending by their base. A file is loaded as an image where an executable mapping of it fits
// its headers; those of its mappings, and those anonymous mappings behind its data, that lie as the headers
// say make the image's segments. The vDSO is an image of one segment.
std::vector<HXLoadedImage> HXFindImages(const HXAddressSpace &addressSpace, uint64_t pageSize,
                                        const HXHeadersOfMapping &headersOf);
