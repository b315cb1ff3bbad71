// Memory graphs: what is read, and reports on them.
#include "platform/capture/GXProcessObjectGraph.h"
#include "support/HXBuilders.h"
#include "support/HXRun.h"

#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include <algorithm>
#include <fstream>

namespace {

// A graph's content; a bar stands for each TAB.
std::string file(std::string records) {
    std::replace(records.begin(), records.end(), '|', '\t');
    return "heft-memgraph 1\n" + records;
}

TEST(GXProcessObjectGraph, ReadsFactsAndRegions) {
    std::string reason;
    HXNamedTags tags;
    const auto graph = GXProcessObjectGraph::directedGraphWithData(
        file("process|pid=42|name=a\"b|description=x, ARM64|page_size=16384\n"
             "region|address=0x4001|length=3|type=__TEXT|path=/a\\tb|user_tag=110\n"
             "region|address=0x8000|length=0x4000|type=arena|prot=-1|max_prot=7|offset=9|user_tag=200"
             "|resident=1|shared_now_private=2|swapped=3|dirty=4294967296|reusable=5|ref_count=6"
             "|external_pager=0|share_mode=4|is_submap=7|object_id=0xffffffff|purgeable=0\n"
             "region|address=0xc000|length=0x4000|type=mapped|user_tag=201|external_pager=1\n"),
        tags, &reason);
    ASSERT_TRUE(graph) << reason;
    EXPECT_EQ(graph->pid(), 42);
    EXPECT_EQ(graph->processName(), "a'b");
    EXPECT_TRUE(graph->is64bit() && graph->showsPhysHeft() && graph->hasSharedRegion());
    std::vector<GXVMRegion> regions;
    graph->enumerateRegionsWithBlock([&](const GXVMRegion &region, bool *) { regions.push_back(region); });
    ASSERT_EQ(regions.size(), 3u);
    EXPECT_EQ(regions[0].path, "/a?b");
    EXPECT_EQ(regions[0].user_tag, 110u);
    const GXVMRegion &r = regions[1];
    EXPECT_EQ(r.prot, -1);
    EXPECT_EQ((std::vector<uint64_t>{r.offset, r.resident_size, r.shared_now_private_size, r.swapped_out_size,
                                     r.dirty_size, r.reusable_size, r.ref_count, r.share_mode, r.is_submap,
                                     r.object_id}),
              (std::vector<uint64_t>{9, 1, 2, 3, uint64_t{1} << 32, 5, 6, 4, 7, 0xffffffff}));
    EXPECT_EQ(tags.nameForTag(r.user_tag), "arena");
    EXPECT_EQ(regions[2].user_tag, 201u);
    EXPECT_EQ(regions[2].purgeable, VM_PURGABLE_DENY);
}

std::string pathOf(const std::string &records) {
    std::string path = temporaryPath();
    std::ofstream(path) << file(records);
    return path;
}

// In the shared region the graph's sizes are bytes that count as they stand; elsewhere whole pages.
TEST(GXProcessObjectGraph, MayHoldAPieceOfTheSharedRegion) {
    for (const auto &[hasOne, dirty] : {std::pair(1, "Heft: 4000 B"), std::pair(0, "Heft: 0 B")}) {
        const std::string path =
            pathOf("process|pid=42|name=g|description=X86-64|page_size=4096|shared_region=" +
                   std::to_string(hasOne) +
                   "\nregion|address=0x7fff00004000|length=0x8000|type=__DATA|path=/lib/a"
                   "|prot=3|max_prot=3|resident=4000|dirty=4000|object_id=9|share_mode=1\n");
        const std::string out = run("host\n", {"-f", "bytes", path}).out;
        EXPECT_NE(out.find(dirty), std::string::npos) << out;
    }
}

TEST(GXProcessObjectGraph, IsReportedBesideLiveProcesses) {
    const std::string path =
        pathOf("process|pid=42|name=g|description=ARM64|page_size=16384|phys_heft=65536\n"
               "region|address=0x4000|length=0x10000|type=mapped file|path=/data/file.db|prot=3|max_prot=3"
               "|resident=65536|dirty=32768|external_pager=1|share_mode=4|object_id=0x32\n");
    const std::string machine = contentOf(TEST_CASES "/two-workers.machine");
    const std::string out = run(machine.substr(machine.find('\n')), {"-f", "bytes", "beta", path}).out;
    const std::string header = "      Dirty         Clean   Reclaimable    Regions    Category\n"
                               "        ---           ---           ---        ---    ---\n";
    for (const std::string with : {"Shared with g [42] (memgraph):\n", "Shared with beta [200]:\n"})
        EXPECT_NE(
            out.find(with + header + "    32768 B       32768 B           0 B          2    mapped file\n"),
            std::string::npos)
            << out;
    EXPECT_NE(out.find("Summary Heft: 49152 B\n"), std::string::npos) << "the shared pages once";
}

} // namespace
