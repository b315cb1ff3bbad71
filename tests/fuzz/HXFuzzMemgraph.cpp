// Fuzz target: any bytes as a memory graph.
#include "platform/HXRegionTags.h"
#include "platform/memgraph/GXProcessObjectGraph.h"

#include <cstdint>
#include <cstdlib>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string reason;
    const auto graph =
        GXProcessObjectGraph::directedGraphWithData({reinterpret_cast<const char *>(data), size}, &reason);
    if ((graph != nullptr) != reason.empty()) std::abort();
    HXNamedTags::shared().clear();
    if (!graph) return 0;
    uint64_t end = 0;
    graph->enumerateRegionsWithBlock([&](const GXVMRegion &region, bool *) {
        if (region.address < end || region.length == 0) std::abort();
        end = region.address + region.length;
    });
    return 0;
}
