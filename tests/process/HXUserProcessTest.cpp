// Gathering of live processes, over made-up machines.
#include "process/HXUserProcess.h"

#include "process/HXProcessSnapshot.h"
#include "support/HXBuilders.h"
#include "support/HXMadeUpMachine.h"
#include "support/HXRun.h"

#include <gtest/gtest.h>
#include <sstream>

namespace {
using Lines = std::vector<std::string>;

// One line of a region: START+SIZE NAME DETAIL, its sizes (dDIRTY sSWAPPED cCLEAN rRECLAIMABLE, none when 0),
// what it is, #OBJECT and @OFFSET where not 0; all numbers hexadecimal.
std::string told(const HXMemoryRegion &region) {
    std::ostringstream line;
    region.start() == kNoAddress ? line << "nowhere" << std::hex : line << std::hex << region.start();
    line << '+' << region.size() << ' ' << region.fullName();
    const auto size = [&](const char *title, uint64_t bytes) {
        if (bytes != 0) line << ' ' << title << bytes;
    };
    size("d", region.dirtySize());
    size("s", region.swappedSize());
    size("c", region.cleanNonSpecSize());
    size("r", region.reclaimableSize());
    if (region.wired()) line << " wired";
    if (region.ownedExclusivelyByParentProcess()) line << " owned";
    if (region.inSharedCache()) line << (region.unusedSharedCacheRegion() ? " unused" : " cache");
    size("#", region.object_id());
    size("@", region.offset());
    return line.str();
}

// The page runs of a region: LOCATION+LENGTH and the amounts.
std::string runsOf(const HXMemoryRegion &region) {
    if (region.subrangeList() == nullptr) return "none";
    std::ostringstream text;
    text << std::hex;
    for (const auto &[location, run] : region.subrangeList()->nodes()) {
        text << (text.tellp() > 0 ? ", " : "") << location << '+' << run.length;
        for (const auto &[title, bytes] : {std::pair{'d', run.dirty},
                                           {'s', run.swapped},
                                           {'c', run.clean},
                                           {'r', run.reclaimable},
                                           {'w', run.wired}})
            if (bytes != 0) text << ' ' << title << bytes;
    }
    return text.str();
}

struct Gathered {
    HXMemoryRegionList list;
    Lines regions;
    Lines warnings;
    Lines errors;
    std::string aux; // as JSON; empty when there is none
    std::string err; // standard error
};
// Process 7 of a machine, gathered.
Gathered gather(const std::string &machine, bool hidden = false) {
    const HXMadeUpMachine current(machine);
    Gathered gathered;
    std::unique_ptr<HXProcess> process;
    const HXPrinted printed = printedBy([&] {
        HXProcessSnapshot snapshot;
        process = HXProcess::processWithPid(7, snapshot);
        process->setHiddenFromDisplay(hidden);
        process->gatherData();
    });
    gathered.err = printed.err;
    for (const HXMemoryRegion &region : process->memoryRegions())
        gathered.regions.push_back(told(region));
    gathered.list = std::move(process->memoryRegions());
    gathered.warnings = process->warnings();
    gathered.errors = process->errors();
    if (const HXAuxTree aux = process->auxData()) gathered.aux = aux->jsonRepresentation();
    return gathered;
}

// A machine with the process alone; its ledgers hold no page tables unless given.
std::string machine(const std::string &processFields, const std::string &hostFields = "") {
    const bool hasLedger = hostFields.find("ledger") != std::string::npos;
    return "host  self_region_heft=1" + hostFields + (hasLedger ? "" : "  ledger=other") +
           "\nprocess  pid=7  name=p" + processFields + "\n";
}
std::string at(uint64_t address, uint64_t size, const std::string &facts) {
    return region(7, address, size, facts);
}
std::string image(const char *path, const std::vector<std::tuple<const char *, uint64_t, uint64_t>> &segments,
                  uint64_t base) {
    std::string text = "image  pid=7  path=" + std::string(path) + "  base=" + std::to_string(base) + "\n";
    for (const auto &[name, start, end] : segments)
        text += "segment  pid=7  name=" + std::string(name) + "  start=" + std::to_string(base + start) +
                "  size=" + std::to_string(end - start) + "\n";
    return text;
}

constexpr uint64_t kCache = 0x180000000;
constexpr char kBail[] = "bailing out for process p [7]; data may be incomplete!\n";
} // namespace

TEST(HXUserProcessTest, RegionsTakeTheirSizesFromTheKernelsRecord) {
    struct {
        const char *title;
        std::string facts; // of ten pages of 16 KiB at 4000
        std::string line, lineByObjects;
    } cases[] = {
        {"private", "resident=8  dirtied=4  swapped=2  reusable=1  tag=2",
         "MALLOC_SMALL d10000 s8000 cc000 r4000", "MALLOC_SMALL d1c000 s8000 r4000"},
        {"counts that disagree", "resident=1  dirtied=2  reusable=1  tag=2", "MALLOC_SMALL d8000 r4000",
         "MALLOC_SMALL r4000"},
        {"file", "resident=5  dirtied=4  dirtied_object=1  pager=1  path=/f", "mapped file /f d10000 c4000",
         "mapped file /f d4000 c10000"},
        {"wired", "resident=1  dirtied=1  wired=3  tag=2", "MALLOC_SMALL d4000 wired",
         "MALLOC_SMALL d4000 wired"},
        {"page counts of 32 bits", "resident=0xffffffff  dirtied=0xffffffff  tag=2",
         "MALLOC_SMALL d3fffffffc000", "MALLOC_SMALL d3fffffffc000"},
        // Not knowing the objects that the process owns, it is taken to own what can be purged.
        {"volatile", "resident=10  dirtied=10  swapped=2  purge=1  tag=2", "MALLOC_SMALL r28000 owned",
         "MALLOC_SMALL r28000"},
        {"empty", "swapped=2  purge=2  tag=2", "MALLOC_SMALL r28000", "MALLOC_SMALL r28000"},
        {"not volatile", "resident=8  dirtied=4  swapped=2  reusable=1  purge=0  tag=2",
         "MALLOC_SMALL d1c000 r4000 owned", "MALLOC_SMALL d1c000 s8000 r4000"},
        {"purgeable file", "resident=2  dirtied=1  purge=0  pager=1", "mapped file d4000 c4000",
         "mapped file d4000 c4000"},
        {"identifiers", "object_id=5  full_object_id=0x700000005  offset=0x123456789000  tag=2",
         "MALLOC_SMALL #700000005 @123456789000", "MALLOC_SMALL #700000005 @123456789000"},
        {"an older record", "object_id=5  full_object_id=0x700000005  short_record=1  tag=2",
         "MALLOC_SMALL #5", "MALLOC_SMALL #5"},
        {"only in the kernel's charge", "heft_only=1  tag=2", "MALLOC_SMALL", ""},
    };
    for (const auto &test : cases)
        for (const bool breakDown : {true, false}) {
            std::string text = machine("") + at(0x4000, 0x28000, test.facts);
            if (!breakDown) text.replace(text.find("heft=1"), 6, "heft=0");
            const Gathered gathered = gather(text);
            const std::string &line = breakDown ? test.line : test.lineByObjects;
            EXPECT_EQ(gathered.regions, line.empty() ? Lines{} : Lines{"4000+28000 " + line}) << test.title;
            EXPECT_EQ(gathered.errors, Lines{});
        }
}

TEST(HXUserProcessTest, RegionsOfImagesAreNamedBySegment) {
    const std::string text =
        machine("") +
        image("/bin/b", {{"__DATA extra", 0x8000, 0x10000}, {"odd", 0x10000, 0x14000}}, 0x20000) +
        image("/bin/a", {{"MACH_HEADER", 0, 0x4000}, {"__LINKEDIT", 0x4000, 0x8000}}, 0x10000) +
        at(0x10000, 0x4000, "pager=1  path=/other") + at(0x14000, 0x4000, "resident=1") +
        at(0x18000, 0x4000, "tag=30") + at(0x28000, 0x10000, "tag=30  dirtied=1  resident=1") +
        at(0x40000, 0x4000, "tag=30");
    EXPECT_EQ(gather(text).regions,
              (Lines{"10000+4000 __TEXT /bin/a", "14000+4000 __LINKEDIT /bin/a c4000", "18000+4000 stack",
                     "28000+10000 __DATA /bin/b d4000", "40000+4000 stack"}));
    EXPECT_EQ(gather(text, true).regions,
              (Lines{"10000+4000 mapped file /other", "14000+4000 untagged (\"VM_ALLOCATE\") c4000",
                     "18000+4000 stack", "28000+10000 stack d4000", "40000+4000 stack"}));
}

TEST(HXUserProcessTest, OwnedObjectsAreChargedMappedOrNot) {
    const auto owned = [](const char *facts) { return "owned  pid=7  " + std::string(facts) + "\n"; };
    const std::string full =
        "  virtual=0x20000  resident=0x14000  wired=0x8000  reusable=0x4000  compressed=0xc000";
    const std::string fakeRegion = at(0x40000, 0x4000, "tag=0xffffffff  dirtied=3  swapped=2  object_id=9");
    struct {
        const char *title;
        std::string process, records;
        Lines regions, warnings;
    } cases[] = {
        {"mapped: the sizes are the object's",
         "",
         owned(("object_id=0x50" + full).c_str()) + at(0x4000, 0x20000, "tag=2  object_id=0x50  resident=1"),
         {"4000+20000 MALLOC_SMALL d10000 sc000 r4000 owned #50"},
         {}},
        {"mapped twice: the object is charged once",
         "",
         owned(("object_id=0x50" + full + "  flags=0x30").c_str()) +
             at(0x4000, 0x8000, "tag=2  object_id=0x50  resident=1") +
             at(0x10000, 0x8000, "tag=2  object_id=0x50  resident=1"),
         {"4000+8000 MALLOC_SMALL d10000 sc000 r4000 owned #50", "10000+8000 MALLOC_SMALL c4000 #50"},
         {}},
        {"mapped as a file: it stays unmapped",
         "",
         owned(("object_id=0x50" + full).c_str()) + at(0x4000, 0x8000, "pager=1  object_id=0x50"),
         {"4000+8000 mapped file #50",
          "nowhere+20000 Owned physical heft (unmapped) d10000 sc000 r4000 wired owned #50"},
         {}},
        {"not mapped, by state",
         "",
         owned(("object_id=1" + full).c_str()) + owned(("object_id=2  flags=0x10" + full).c_str()) +
             owned(("object_id=3  flags=0x20" + full).c_str()) +
             owned(("object_id=4  flags=0x31" + full).c_str()) +
             owned("object_id=5  virtual=0x4000  flags=0xffffffffffffff8e"),
         {"nowhere+20000 Owned physical heft (unmapped) d10000 sc000 r4000 wired owned #1",
          "nowhere+20000 Owned physical heft (unmapped) d8000 r4000 wired owned #2",
          "nowhere+20000 Owned physical heft (unmapped) d8000 r4000 wired owned #3",
          "nowhere+20000 Owned physical heft (unmapped) r4000 wired owned #4",
          "nowhere+4000 Owned physical heft (unmapped) owned #5"},
         {}},
        {"a later record replaces an earlier one",
         "",
         owned("object_id=1  resident=0x4000") + owned("object_id=1  resident=0x8000  virtual=1"),
         {"nowhere+1 Owned physical heft (unmapped) d8000 owned #1"},
         {}},
        {"known, they stand for the kernel's own region, and what can be purged is not owned",
         "  owned_none=1",
         at(0x4000, 0x4000, "tag=2  resident=1  purge=0  dirtied=1") + fakeRegion,
         {"4000+4000 MALLOC_SMALL d4000"},
         {}},
        {"unknown, the kernel's region closes the walk and the list",
         "",
         at(0x4000, 0x4000, "tag=2") + fakeRegion + at(0x50000, 0x4000, "tag=2"),
         {"4000+4000 MALLOC_SMALL", "nowhere+4000 Owned physical heft (unmapped) dc000 s8000 #9"},
         {}},
        {"what was attributed is taken out, dirty first",
         "",
         at(0x4000, 0x10000, "tag=2  resident=4  dirtied=1  purge=0") + fakeRegion,
         {"4000+10000 MALLOC_SMALL d10000 owned", "nowhere+4000 Owned physical heft (unmapped) s4000 #9"},
         {}},
        {"more than all of it",
         "",
         at(0x4000, 0x18000, "tag=2  resident=6  purge=0") + fakeRegion,
         {"4000+18000 MALLOC_SMALL d18000 owned"},
         {"p [7]: Heft changed while analyzing – unmapped owned physical heft may be over-counted by 16384 "
          "bytes"}},
        {"page tables come last",
         "  page_table=20480  owned_none=1",
         at(0x4000, 0x4000, "tag=2"),
         {"4000+4000 MALLOC_SMALL", "nowhere+5000 page table d5000 #ffffffffffffffff"},
         {}},
        {"a failed query",
         "  owned_error=13",
         fakeRegion,
         {"nowhere+4000 Owned physical heft (unmapped) dc000 s8000 #9"},
         {"p [7]: vm.get_owned_vmobjects - Permission denied"}},
    };
    for (const auto &test : cases) {
        const std::string pageTable =
            test.process.find("page_table") == std::string::npos ? "  page_table=0" : "";
        const Gathered gathered =
            gather(machine(test.process + pageTable, "  ledger=page_table") + test.records);
        EXPECT_EQ(gathered.regions, test.regions) << test.title;
        EXPECT_EQ(gathered.warnings, test.warnings) << test.title;
        EXPECT_EQ(gathered.errors, Lines{}) << test.title;
    }
    // The reply is asked for in steps of 896 bytes; the analysis by objects does not ask at all.
    std::string many = machine("");
    for (int i = 1; i <= 100; i++)
        many += "owned  pid=7  object_id=" + std::to_string(i) + "\n";
    EXPECT_EQ(gather(many).regions.size(), 100u);
    EXPECT_EQ(gather(many, true).regions.size(), 0u); // nor does a hidden process
    many.replace(many.find("heft=1"), 6, "heft=0");
    EXPECT_EQ(gather(many).regions.size(), 0u);
}

TEST(HXUserProcessTest, SharedRegionEntriesAreCutByImages) {
    const std::string below = at(0x100000000, 0x4000, "tag=2");
    const std::string belowLine = "100000000+4000 MALLOC_SMALL";
    struct {
        const char *title;
        std::string records;
        Lines regions;
    } cases[] = {
        {"one image in the middle",
         below + image("/lib/a", {{"__TEXT", 0x4000, 0x8000}}, kCache) +
             at(kCache, 0x10000, "max_prot=1  offset=0x100000  wired=1"),
         {belowLine, "180000000+4000 unused dyld shared cache area wired unused #1 @100000",
          "180004000+4000 __TEXT /lib/a wired cache #1 @104000",
          "180008000+8000 unused dyld shared cache area wired unused #1 @108000"}},
        {"ends are rounded up before an aligned start, and at the last image",
         below + image("/lib/a", {{"__TEXT", 0, 0x1800}, {"__LINKEDIT", 0x2000, 0x2900}}, kCache) +
             image("/lib/b", {{"__DATA", 0x3800, 0x3900}, {"other", 0x4000, 0x4100}}, kCache) +
             at(kCache, 0x8000, "max_prot=1"),
         {belowLine, "180000000+2000 __TEXT /lib/a cache #1",
          "180002000+900 __LINKEDIT dyld shared cache cache #1 @2000",
          "180002900+f00 unused dyld shared cache area unused #1 @2900",
          "180003800+100 __DATA /lib/b cache #1 @3800",
          "180003900+700 unused dyld shared cache area unused #1 @3900",
          "180004000+1000 other /lib/b cache #1 @4000",
          "180005000+3000 unused dyld shared cache area unused #1 @5000"}},
        {"an image across two entries, and one beyond them",
         below + image("/lib/a", {{"__TEXT", 0x2000, 0x6000}, {"__DATA", 0x9000, 0xa000}}, kCache) +
             at(kCache, 0x4000, "max_prot=1") + at(kCache + 0x4000, 0x4000, "max_prot=1  offset=0x8000"),
         {belowLine, "180000000+2000 unused dyld shared cache area unused #1",
          "180002000+2000 __TEXT /lib/a cache #1 @2000", "180004000+2000 __TEXT /lib/a cache #1 @8000",
          "180006000+2000 unused dyld shared cache area unused #1 @a000"}},
        // No mapping far enough below the shared region: the recursive query describes the entry.
        {"nothing below",
         at(kCache, 0x4000, "max_prot=1  object_id=0x77  share_mode=4"),
         {"180000000+4000 unused dyld shared cache area unused #77"}},
        {"top-level mappings are asked for within the shared region only",
         below + at(kCache, 0x4000, "max_prot=1  object_id=0x77") +
             at(kCache + 0x4000, 0x4000, "max_prot=1") + at(kCache + 0x100000000, 0x4000, "tag=30") +
             "top  pid=7  address=0x100000000  size=0x4000\ntop  pid=7  address=0x180000000  size=0x8000\n"
             "top  pid=7  address=0x280000000  size=0x8000\n",
         {belowLine, "180000000+8000 unused dyld shared cache area unused #1", "280000000+4000 stack"}},
    };
    for (const auto &test : cases) {
        const Gathered gathered = gather(machine("") + test.records);
        EXPECT_EQ(gathered.regions, test.regions) << test.title;
        EXPECT_EQ(gathered.err, "") << test.title;
    }
    // A hidden process's shared region is left out; a host may have none; a 32-bit process has its own.
    const std::string cache = below + at(kCache, 0x4000, "max_prot=1  tag=30");
    EXPECT_EQ(gather(machine("") + cache, true).regions, Lines{belowLine});
    EXPECT_EQ(gather(machine("", "  shared_region=0") + cache).regions,
              (Lines{belowLine, "180000000+4000 stack"}));
    EXPECT_EQ(
        gather(machine("  flags=0") + at(0x40000000, 0x4000, "max_prot=1") + cache).regions,
        (Lines{"40000000+4000 unused dyld shared cache area unused", belowLine, "180000000+4000 stack"}));
}

// Pieces that share pages of 16 KiB: each counts its own bytes of them, once.
TEST(HXUserProcessTest, WritableSharedPiecesCountTheirBytesOfSharedPages) {
    // dirty; present and internal, which counts as dirty; paged out; present and external, which counts
    // nowhere
    const std::string pages = "  pages=1*9,1*1,1*0x10,1*0x81";
    const std::string records =
        image("/lib/a", {{"__DATA", 0, 0x4800}, {"__DATA_DIRTY", 0x8800, 0x9000}, {"__AUTH", 0x9000, 0xa000}},
              kCache) +
        at(0x100000000, 0x4000, "tag=2") + at(kCache, 0x10000, "max_prot=3" + pages);
    EXPECT_EQ(gather(machine("") + records).regions,
              (Lines{"100000000+4000 MALLOC_SMALL", "180000000+4800 __DATA /lib/a d4800 cache #1",
                     "180004800+4000 unused dyld shared cache area d3800 s800 unused #1 @4800",
                     "180008800+800 __DATA_DIRTY /lib/a s800 cache #1 @8800",
                     "180009000+1000 __AUTH /lib/a s1000 cache #1 @9000",
                     "18000a000+6000 unused dyld shared cache area s2000 unused #1 @a000"}));
    // A failed query ends the walk; what was found stays.
    const std::string fault = "fault  pid=7  call=mach_vm_page_range_query  from=2  error=4  becomes=";
    for (const auto &[fate, suffix] :
         {std::pair{"alive", ""}, {"gone", " (process exited)"}, {"zombie", " (zombie)"}}) {
        const Gathered gathered =
            gather(machine("") + records + at(0x300000000, 0x4000, "tag=2") + fault + fate + "\n");
        EXPECT_EQ(gathered.regions.size(), 3u) << fate;
        EXPECT_EQ(gathered.err,
                  std::string("mach_vm_page_range_query: (os/kern) invalid argument\n") + kBail);
        const Lines message{std::string("p [7]: (os/kern) invalid argument") + suffix};
        EXPECT_EQ(gathered.errors, *suffix ? Lines{} : message);
        EXPECT_EQ(gathered.warnings, *suffix ? message : Lines{});
    }
}

TEST(HXUserProcessTest, RegionsOfMixedPagesAreCutIntoRuns) {
    const std::string some = "share_mode=4  resident=3  dirtied=2  swapped=1  tag=2";
    struct {
        const char *title;
        uint64_t pages;
        std::string facts, runs;
    } cases[] = {
        {"a page that is not resident parts runs", 5, some + "  pages=2*9,1*0x10,1*0,1*1",
         "0+3000 d2000 s1000, 4000+1000 c1000"},
        {"paged out before dirty, dirty before reusable", 8,
         some + "  pages=1*0x18,1*0x809,2*0,1*0x801,1*0x800,1*0,1*1",
         "0+2000 d1000 s1000, 4000+2000 r2000, 7000+1000 c1000"},
        {"volatile pages are reclaimable when present", 8,
         "share_mode=4  purge=1  resident=3  tag=2  pages=1*9,1*0x10,1*0,2*1,1*0x800,1*0x80,1*0",
         "0+2000 d1000 s1000, 3000+2000 r2000"},
        {"runs lie at the offset in the object", 3, some + "  offset=0x1234567000  pages=1*0,1*9,1*1",
         "1234568000+2000 d1000 c1000"},
        {"wired runs are wired whole", 3, some + "  wired=1  pages=1*9,1*0,1*1",
         "0+1000 d1000 w1000, 2000+1000 c1000 w1000"},
        {"chunks of 4,096 pages do not part runs", 4098, some + "  pages=4095*0,2*1,1*0",
         "fff000+2000 c2000"},
        {"private memory is not cut", 5, "share_mode=2  resident=3  dirtied=2  pages=2*9,1*1", "none"},
    };
    for (const auto &test : cases) {
        const std::string records = at(0x1000000, test.pages * 4096, test.facts);
        const Gathered gathered = gather(machine("  owned_none=1", "  page_size=4096") + records);
        ASSERT_EQ(gathered.list.size(), 1u);
        EXPECT_EQ(runsOf(gathered.list[0]), test.runs) << test.title;
        EXPECT_EQ(runsOf(gather(machine("  owned_none=1", "  page_size=4096") + records, true).list[0]),
                  "none");
    }
    // A query that fails in the middle keeps the runs it has; the walk goes on.
    const Gathered gathered = gather(
        machine("", "  page_size=4096") + at(0x1000000, 4098 * 4096, some + "  pages=1*9,4094*0,2*1,1*0") +
        at(0x3000000, 4096, "tag=2") + "fault  pid=7  call=mach_vm_page_range_query  from=2  error=1\n");
    EXPECT_EQ(gathered.regions.size(), 2u);
    EXPECT_EQ(runsOf(gathered.list[0]), "0+1000 d1000");
    EXPECT_EQ(gathered.errors, Lines{"p [7]: (os/kern) invalid address"});
}

TEST(HXUserProcessTest, FailedWalksAreErrorsUnlessTheProcessIsGone) {
    const std::string records = at(0x100000000, 0x4000, "tag=2") + at(0x200000000, 0x4000, "tag=2") +
                                at(0x290000000, 0x4000, "tag=2");
    const std::string fake = at(0x2a0000000, 0x4000, "tag=0xffffffff");
    const std::string recurse = "mach_vm_region_recurse";
    struct {
        std::string call, fault, message;
        bool isError;
        size_t regions;
    } cases[] = {
        {recurse, "from=2  error=5", "(os/kern) failure", true, 2},
        {recurse, "from=2  error=0x10000003", "(ipc/send) invalid destination port", true, 2},
        {recurse, "from=2  error=0x10000003  becomes=gone",
         "(ipc/send) invalid destination port (process exited)", false, 2},
        {recurse, "from=1  error=0x10000003  becomes=zombie", "(ipc/send) invalid destination port (zombie)",
         false, 0},
        {recurse, "from=2  error=6  becomes=gone", "(os/kern) resource shortage", true, 2},
        // The end of the address space, wherever it comes.
        {recurse, "from=2  error=1", "", true, 2},
        // Eight queries look for the last mapping below the shared region; the ninth is the walk's.
        {"mach_vm_region", "from=9  error=77", "unknown error code", true, 1},
        {"mach_vm_region", "from=9  error=1", "", true, 1},
        {"mach_vm_region", "from=1  error=5", "", true, 3},
    };
    // The second mapping lies in the shared region, and is not asked for by the recursive query.
    for (const auto &test : cases) {
        const Gathered gathered =
            gather(machine("") + records + "fault  pid=7  call=" + test.call + "  " + test.fault + "\n");
        EXPECT_EQ(gathered.regions.size(), test.regions) << test.fault;
        const std::string printed =
            test.call + ": " + test.message.substr(0, test.message.rfind(" (")) + "\n";
        EXPECT_EQ(gathered.err, test.message.empty() ? "" : printed + kBail) << test.fault;
        const Lines message = test.message.empty() ? Lines{} : Lines{"p [7]: " + test.message};
        EXPECT_EQ(gathered.errors, test.isError ? message : Lines{}) << test.fault;
        EXPECT_EQ(gathered.warnings, test.isError ? Lines{} : message) << test.fault;
    }
    // After the kernel's closing region, too, only the end of the address space is no failure.
    const Gathered closed =
        gather(machine("") + records + fake + "fault  pid=7  call=mach_vm_region_recurse  from=4  error=5\n");
    EXPECT_EQ(closed.errors, Lines{"p [7]: (os/kern) failure"});
}

TEST(HXUserProcessTest, ReadsFiguresAndFindsTheLedger) {
    std::string eighty = "e0";
    for (int i = 1; i < 80; i++)
        eighty += ",e" + std::to_string(i);
    const Lines tables{"nowhere+1000 page table d1000 #ffffffffffffffff"};
    EXPECT_EQ(gather(machine("  page_table=4096", "  ledger=" + eighty + ",page_table")).regions, tables);
    EXPECT_EQ(gather(machine("  page_table=-4096", "  ledger=page_table")).regions, Lines{});
    EXPECT_EQ(gather(machine("  page_table=4096", "  ledger=page_tables,page_tabl")).regions, Lines{});
    const Gathered refused = gather(machine("", "  ledger=page_table"));
    const std::string message = "p [7]: Unable to retrieve ledger entry info - Operation not permitted";
    EXPECT_EQ(refused.warnings, Lines{message});
    EXPECT_EQ(refused.err, message + "\n");
    EXPECT_EQ(gather("host  self_region_heft=1\nprocess  pid=7  page_table=4096\n").err,
              "Unable to retrieve ledger template info: Function not implemented\n");
    EXPECT_EQ(gather(machine("  heft_peak=9")).aux, "");
    EXPECT_EQ(gather(machine("  heft=5  heft_peak=9")).aux, R"({"phys_heft":5,"phys_heft_peak":9})");
}
