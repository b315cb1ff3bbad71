// Memory graphs: what is read, what breaks the form, and what is written of a process.
#include "platform/capture/GXProcessObjectGraph.h"
#include "platform/HXRegionTags.h"
#include "platform/replay/HXReplayPlatform.h"
#include "record/HXMemgraphRecorder.h"
#include "support/HXBarePlatform.h"

#include <gtest/gtest.h>

#include <algorithm>

namespace {

std::string tabbed(std::string text) {
    std::replace(text.begin(), text.end(), '|', '\t');
    return text;
}

std::unique_ptr<GXProcessObjectGraph> load(const std::string &records, std::string *reason,
                                           HXNamedTags &tags) {
    reason->clear();
    return GXProcessObjectGraph::directedGraphWithData("heft-memgraph 1\n" + tabbed(records), tags, reason);
}

const std::string kProcess = "process|pid=42|name=a\"b|description=x, ARM64|page_size=16384\n";

std::vector<GXVMRegion> regionsOf(const GXProcessObjectGraph &graph) {
    std::vector<GXVMRegion> regions;
    graph.enumerateRegionsWithBlock([&](const GXVMRegion &region, bool *) { regions.push_back(region); });
    return regions;
}

TEST(GXProcessObjectGraph, ReadsFactsAndRegions) {
    std::string reason;
    HXNamedTags tags;
    const auto graph =
        load(kProcess + "region|address=0x4001|length=3|type=__TEXT|path=/a\\tb|user_tag=110\n"
                        "region|address=0x8000|length=0x4000|type=arena|prot=-1|max_prot=7|offset=9"
                        "|user_tag=200|resident=1|shared_now_private=2|swapped=3|dirty=4294967296"
                        "|reusable=5|ref_count=6|external_pager=0|share_mode=4|is_submap=7"
                        "|object_id=0xffffffff|purgeable=0\n"
                        "region|address=0xc000|length=0x4000|type=mapped|user_tag=201|external_pager=1\n",
             &reason, tags);
    ASSERT_TRUE(graph) << reason;
    EXPECT_EQ(graph->pid(), 42);
    EXPECT_EQ(graph->processName(), "a'b");
    EXPECT_TRUE(graph->is64bit() && graph->showsPhysHeft() && graph->hasSharedRegion());
    const auto regions = regionsOf(*graph);
    ASSERT_EQ(regions.size(), 3u);
    EXPECT_EQ(regions[0].path, "/a?b");
    EXPECT_EQ(regions[0].user_tag, 110u);
    const GXVMRegion &r = regions[1];
    EXPECT_EQ(r.type, "arena");
    EXPECT_EQ(r.dirty_size, uint64_t{1} << 32);
    EXPECT_EQ((std::vector<uint64_t>{r.offset, r.resident_size, r.shared_now_private_size, r.swapped_out_size,
                                     r.reusable_size, r.ref_count, r.share_mode, r.is_submap, r.object_id}),
              (std::vector<uint64_t>{9, 1, 2, 3, 5, 6, 4, 7, 0xffffffff}));
    EXPECT_EQ(tags.nameForTag(r.user_tag), "arena");
    EXPECT_EQ(regions[2].user_tag, 201u);
}

TEST(GXProcessObjectGraph, NamesTheLineThatBreaksTheForm) {
    const struct {
        std::string records;
        const char *reason; // its beginning
    } cases[] = {
        {"", "line 1: no process record"},
        {kProcess + kProcess, "line 3: a second process record"},
        {"process|pid=1|name=x|page_size=4096\n", "line 2: missing field \"description\""},
        {"process|pid=1|name=x|description=x|page_size=12288\n", "line 2: page_size"},
        {kProcess + "region|address=1|length=0|type=x\n", "line 3: a length of 0"},
        {kProcess + "region|address=1|length=0x200000000000001|type=x\n", "line 3: it is longer"},
        {kProcess + "region|address=0xffffffffffffffff|length=1|type=x\n", "line 3: it ends beyond"},
        {kProcess + "region|address=4|length=4|type=x\nregion|address=7|length=1|type=x\n",
         "line 4: it overlaps"},
        {kProcess + "region|address=4|length=4|type=x|share_mode=256\n", "line 3: share_mode"},
        {kProcess + "host\n", "line 3: unknown record \"host\""},
    };
    for (const auto &test : cases) {
        std::string reason;
        HXNamedTags tags;
        const bool loaded = load(test.records, &reason, tags) != nullptr;
        EXPECT_EQ(loaded, reason.empty());
        EXPECT_EQ(reason.substr(0, std::max<size_t>(1, std::string(test.reason).size())), test.reason)
            << reason;
    }
    std::string reason;
    HXNamedTags tags;
    EXPECT_FALSE(GXProcessObjectGraph::directedGraphWithData("heft-machine 1\n", tags, &reason));
    EXPECT_EQ(reason, "not a memory graph");
}

// Records the process 5 of a machine as a graph and gives its text, or the reason.
std::string recorded(const std::string &records, bool breakDown) {
    HXLinuxServices services;
    std::string reason, text;
    const auto machine = HXMachine::loadText("heft-machine 1\n" + tabbed(records), &reason);
    if (!machine) return reason;
    HXReplayPlatform host(*machine, services);
    std::FILE *const file = std::tmpfile();
    HXMemgraphRecorder recorder(host, file, [](uint32_t tag) { return "tag " + std::to_string(tag); });
    if (recorder.record(5, "worker", breakDown, &reason)) {
        text.resize(static_cast<size_t>(std::ftell(file)));
        std::rewind(file);
        EXPECT_EQ(std::fread(text.data(), 1, text.size(), file), text.size());
    }
    std::fclose(file);
    std::replace(text.begin(), text.end(), '\t', '|');
    const size_t description = text.find("|description="), end = text.find('|', description + 1);
    if (description != std::string::npos) text.erase(description, end - description); // this machine's
    return text.empty() ? reason : text;
}

const std::string kHost = "host|page_size=4096|self_region_heft=1|ledger=cpu,page_table\n";

TEST(HXMemgraphRecorder, WritesWhatALiveWalkFinds) {
    const std::string machine =
        kHost +
        "process|pid=5|comm=worker|heft=40960|heft_peak=50000|page_table=12288\n"
        "image|pid=5|path=/lib/x.so|base=0x1000\n"
        "segment|pid=5|name=MACH_HEADER|start=0x1000|size=0x1000\n"
        "segment|pid=5|name=__DATA x|start=0x2000|size=0x1000\n"
        "region|pid=5|address=0x1000|size=0x1000|resident=1|pager=1|share_mode=1|object_id=7|path=/l\n"
        "region|pid=5|address=0x2000|size=0x1000|prot=1|dirtied=1|resident=1|object_id=7"
        "|full_object_id=0x100000007\n"
        "region|pid=5|address=0x4000|size=0x1000|pager=1|share_mode=4|object_id=8|path=/data\n"
        "region|pid=5|address=0x5000|size=0x2000|tag=101|resident=2|swapped=1|dirtied=2|dirtied_object=1"
        "|purge=0|object_id=7|full_object_id=0x100000007\n"
        "region|pid=5|address=0xffffffffff600000|size=0x1000|tag=31|share_mode=3\n";
    const std::string start = "heft-memgraph 1\nprocess|pid=5|name=worker|page_size=4096|phys_heft=40960"
                              "|phys_heft_peak=50000";
    const std::string images =
        "|shared_region=0\n"
        "region|address=0x1000|length=0x1000|type=__TEXT|path=/lib/x.so|prot=3|max_prot=7"
        "|resident=4096|external_pager=1|share_mode=1|object_id=0x7\n"
        "region|address=0x2000|length=0x1000|type=__DATA|path=/lib/x.so|prot=1|max_prot=7"
        "|resident=4096|dirty=4096|object_id=0x8\n"
        "region|address=0x4000|length=0x1000|type=mapped file|path=/data|prot=3"
        "|max_prot=7|external_pager=1|share_mode=4|object_id=0x9\n"
        "region|address=0x5000|length=0x2000|type=tag 101|prot=3|max_prot=7|user_tag=101"
        "|resident=8192|swapped=4096|dirty=";
    const std::string end = "region|address=0xffffffffff600000|length=0x1000|type=tag 31|prot=3|max_prot=7"
                            "|user_tag=31|share_mode=3\n";
    EXPECT_EQ(
        recorded(machine, true),
        start + images + "8192|object_id=0x8|purgeable=0\n" +
            "region|address=0x8000000000000000|length=0x3000|type=page table|user_tag=239|resident=12288"
            "|dirty=12288|share_mode=1|object_id=0xfffffffe\n" +
            end);
    EXPECT_EQ(recorded(machine, false),
              start + "|shows_phys_heft=0" + images + "4096|object_id=0x8|purgeable=0\n" + end);
}

TEST(HXMemgraphRecorder, PutsPageTablesWhereTheyFit) {
    const std::pair<const char *, const char *> cases[] = {
        {"", "\nregion|address=0x8000000000000000|length=0x3000|type=page table"},
        {"region|pid=5|address=0x7fffffffffffd000|size=0x4000\n", "address=0x8000000000001000|length=0x3000"},
        {"region|pid=5|address=0x8000000000002000|size=0x1000\n", "address=0x8000000000003000|length=0x3000"},
    };
    for (const auto &[regions, expected] : cases) {
        const std::string text = recorded(kHost + "process|pid=5|page_table=12288\n" + regions, true);
        EXPECT_NE(text.find(expected), std::string::npos) << text;
    }
}

TEST(HXMemgraphRecorder, SaysWhyAProcessCannotBeRecorded) {
    const std::pair<const char *, const char *> cases[] = {
        {"process|pid=4\n", "No such process"},
        {"process|pid=5|task_error=5\n", "(os/kern) failure"},
        {"process|pid=5|flags=1\n", "the kernel has no memory graph"},
        {"process|pid=5\nfault|pid=5|call=mach_vm_region_recurse|error=268435459|becomes=gone\n",
         "(ipc/send) invalid destination port"},
    };
    for (const auto &[records, reason] : cases)
        EXPECT_EQ(recorded(records, true), reason);
}

} // namespace
