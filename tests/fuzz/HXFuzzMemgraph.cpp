// Fuzz target: any bytes as a memory graph.
#include "platform/capture/GXProcessObjectGraph.h"

#include <cstdint>
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string reason;
    HXNamedTags tags;
    const auto graph = GXProcessObjectGraph::directedGraphWithData(
        {reinterpret_cast<const char *>(data), size}, tags, &reason);
    if ((graph != nullptr) != reason.empty()) std::abort();
    if (!graph) return 0;
    uint64_t end = 0;
    graph->enumerateRegionsWithBlock([&](const GXVMRegion &region, bool *) {
        if (region.address < end || region.length == 0) std::abort();
        end = region.address + region.length;
    });
    return 0;
}
