#include "output/HXOutputFormatterText.h"

#include "support/HXBarePlatform.h"
#include "support/HXBuilders.h"
#include "support/HXRun.h"
#include "support/HXTwoWorkers.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <sstream>

TEST(HXOutputFormatterTextTest, WritesSizesInTheChosenFormat) {
    const HXBarePlatform platform;
    struct {
        uint64_t size;
        const char *bytes, *formatted, *pages;
    } cases[] = {
        {0, "0 B", "0 B", "0 pages"},
        {10000, "10000 B", "10 KB", "1 pages"},
        {16384, "16384 B", "16 KB", "1 pages"},
        {16385, "16385 B", "16 KB", "2 pages"},
        {10239487, "10239487 B", "9999 KB", "625 pages"}, // 9999.499 KB
        {10239488, "10239488 B", "10 MB", "625 pages"},   // 9999.5 KB would need five digits
        {uint64_t{1} << 40, "1099511627776 B", "1024 GB", "67108864 pages"},
    };
    const HXMadeUpProcess process(1, "p");
    for (const int32_t format : {HXFormatBytes, HXFormatFormatted, HXFormatPages}) {
        HXOutputFormatterText formatter(format, 0, "Dirty");
        (void)printedBy([&] { formatter.printProcessHeader(process); });
        for (const auto &test : cases)
            EXPECT_EQ(formatter.formattedStringForSize(test.size), format == HXFormatBytes ? test.bytes
                                                                   : format == HXFormatPages
                                                                       ? test.pages
                                                                       : test.formatted);
    }
}

TEST(HXOutputFormatterTextTest, ShortensPathsUnlessWide) {
    const HXBarePlatform platform;
    const char *cases[][2] = {
        {"/usr/lib/libfoo.dylib", ".../libfoo.dylib"},
        {"/usr/lib/", ".../lib"},
        {"", ""},
        {"/", "/"},
    };
    const HXOutputFormatterText shortened(1, HXTextWired | HXTextSwapped, "Dirty"),
        wide(1, HXTextWide, "Dirty");
    for (const auto &test : cases) {
        const HXString text = HXString::intern(test[0]);
        EXPECT_EQ(shortened._truncatedNameForString(text).str(), test[1]);
        EXPECT_EQ(wide._truncatedNameForString(text), text);
    }
}

TEST(HXOutputFormatterTextTest, SortsRowsByEveryColumn) {
    const HXBarePlatform platform;
    struct Facts {
        const char *name;
        uint64_t dirty, swapped, clean, reclaimable, wired;
        int regions;
    };
    // "d" and "e" tie in all but clean; "a" is dirty by its swapped bytes.
    const Facts facts[] = {{"c", 10, 0, 5, 1, 0, 3},
                           {"e", 10, 0, 4, 2, 0, 1},
                           {"d", 10, 0, 6, 2, 0, 2},
                           {"a", 1, 90, 0, 0, 4096, 5},
                           {"B", 20, 10, 9, 9, 0, 4}};
    std::deque<HXMemoryRegion> regions;
    std::deque<HXMemoryObject> objects;
    HXCategoryMap categories;
    for (const Facts &each : facts) {
        HXMemoryObject &object = objects.emplace_back();
        for (int i = 0; i < each.regions; i++) {
            HXRegionFacts region{.object = 1, .size = 4096, .offset = uint64_t(i) * 65536, .name = each.name};
            if (i == 0) {
                region.dirty = each.dirty, region.swapped = each.swapped, region.clean = each.clean;
                region.reclaimable = each.reclaimable, region.wired = each.wired != 0;
            }
            object.addRegion(regions.emplace_back(makeRegion(region)), 4096);
        }
        object.finalize();
        categories.categoryForObject(object, HXSegmentNoImage, true)
            .addMemoryObject(HXMemoryObject::View(HXMemoryObject::View(), &object));
    }
    const char *cases[][2] = {{"Dirty", "aBdec"},       {"Swapped", "aBcde"}, {"Clean", "Bdcea"},
                              {"Reclaimable", "Bdeca"}, {"Wired", "aBcde"},   {"Regions", "aBcde"},
                              {"Category", "Bacde"}};
    for (const auto &test : cases) {
        const HXOutputFormatterText formatter(1, 0, test[0]);
        std::string order;
        for (const auto *entry : formatter._sortedKeysForCategories(categories))
            order += entry->key;
        EXPECT_EQ(order, test[1]) << test[0]; // ties by key
    }
}

TEST(HXOutputFormatterTextTest, PrintsAWholeReport) {
    const HXRun result = run(kTwoWorkers, {"alpha", "beta"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.err, "");
    EXPECT_EQ(result.out, &R"(
======================================================================
alpha [100]: 64-bit	Heft: 304 KB (16384 bytes per page)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
 240 KB      64 KB          0 B          1    MALLOC_SMALL
  32 KB        0 B          0 B          1    page table
    0 B      32 KB          0 B          1    __TEXT
    ---        ---          ---        ---    ---
 272 KB      96 KB          0 B          3    TOTAL

Shared with beta [200]:
  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
  32 KB      32 KB          0 B          2    mapped file
    ---        ---          ---        ---    ---
  32 KB      32 KB          0 B          2    TOTAL

Auxiliary data:
	phys_heft: 293 KB
	phys_heft_peak: 391 KB

======================================================================
beta [200]: 32-bit	Heft: 48 KB (16384 bytes per page)
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
  16 KB        0 B          0 B          1    MALLOC_LARGE
    ---        ---          ---        ---    ---
  16 KB        0 B          0 B          1    TOTAL

Shared with alpha [100]:
  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
  32 KB      32 KB          0 B          2    mapped file
    ---        ---          ---        ---    ---
  32 KB      32 KB          0 B          2    TOTAL

======================================================================
Summary Heft: 320 KB
======================================================================

  Dirty      Clean  Reclaimable    Regions    Category
    ---        ---          ---        ---    ---
 240 KB      64 KB          0 B          1    MALLOC_SMALL
  32 KB      32 KB          0 B          2    mapped file
  32 KB        0 B          0 B          1    page table
  16 KB        0 B          0 B          1    MALLOC_LARGE
    0 B      32 KB          0 B          1    __TEXT
    ---        ---          ---        ---    ---
 320 KB     128 KB          0 B          6    TOTAL

)"[1]);
}

// In the objects' eyes: dirty pages of a file are those that await writing, other memory's are all resident.
TEST(HXOutputFormatterTextTest, ListsRegionsAndSaysWhenTheBreakdownIsOff) {
    const HXRun result = run(kTwoWorkers, {"200", "-v", "-w", "-f", "bytes", "--vmObjectDirty"});
    EXPECT_EQ(result.out, &R"(
beta [200]

           start                end  [objectid]      VRT     DRT     SWP     CLN     RCL    WIRE   tag (detail)
      ----------         ----------  ----------    -----   -----   -----   -----   -----   -----   ------------
           10000 -            14000 [         3]       1       1       0       0       0       1   MALLOC_LARGE
           20000 -            30000 [        32]       4       2       0       2       0       0   mapped file /data/file.db

==========================================================================================
beta [200]: 32-bit	Heft: 49152 B (16384 bytes per page)
==========================================================================================

      Dirty     (Swapped)         Clean   Reclaimable       (Wired)    Regions    Category
        ---           ---           ---           ---           ---        ---    ---
    32768 B           0 B       32768 B           0 B           0 B          1    mapped file /data/file.db
    16384 B           0 B           0 B           0 B       16384 B          1    MALLOC_LARGE
        ---           ---           ---           ---           ---        ---    ---
    49152 B           0 B       32768 B           0 B       16384 B          2    TOTAL

VM Object Dirty Analysis: Enabled
)"[1]);
}

TEST(HXOutputFormatterTextTest, ListsRegionsOfEveryKind) {
    const HXBarePlatform platform;
    HXMadeUpProcess process(7, "p");
    process.setPageSize(4096);
    HXMemoryRegionList regions;
    struct {
        HXRegionFacts facts;
        const char *narrow, *wide;
    } cases[] = {
        {{.object = 0x12345,
          .start = 0x100000000,
          .size = 4096,
          .dirty = 4096,
          .name = "__TEXT",
          .detail = "/x/foo"},
         "       100000000 -        100001000 [     12345]       1       1       0       0   __TEXT .../foo",
         "       100000000 -        100001000 [     12345]       1       1       0       0       0       0   "
         "__TEXT /x/foo"},
        {{.start = kNoAddress, .size = 8193, .dirty = 4096, .swapped = 4097, .wired = true},
         "        unmapped -         unmapped [         0]       3       3       0       0   memory",
         "        unmapped -         unmapped [         0]       3       3       2       0       0       3   "
         "memory"},
        {{.object = 0xABCDEF0123456789,
          .start = 0xFFFFFFFFFFFF0000,
          .size = 1,
          .clean = 1,
          .reclaimable = 5000},
         "ffffffffffff0000 - ffffffffffff0001 [ 123456789]       1       0       1       2   memory",
         "ffffffffffff0000 - ffffffffffff0001 [ 123456789]       1       0       0       1       2       0   "
         "memory"},
        {{.object = 1, .start = 0, .detail = "été"},
         "               0 -                0 [         1]       0       0       0       0   memory été",
         "               0 -                0 [         1]       0       0       0       0       0       0   "
         "memory été"},
    };
    std::string narrow =
        "p [7]\n\n"
        "           start                end  [objectid]      VRT     DRT     CLN     RCL   tag "
        "(detail)\n"
        "      ----------         ----------  ----------    -----   -----   -----   -----   "
        "------------\n";
    std::string wide = narrow;
    wide.insert(wide.find("     CLN"), "     SWP").insert(wide.find("   tag"), "    WIRE");
    wide.insert(wide.find("   ------------"), "   -----   -----");
    for (const auto &test : cases) {
        regions.push_back(makeRegion(test.facts));
        narrow += std::string(test.narrow) + "\n";
        wide += std::string(test.wide) + "\n";
    }
    const auto listing = [&](int32_t options, const HXMemoryRegionList &list) {
        const HXPrinted printed = printedBy([&] {
            HXOutputFormatterText formatter(HXFormatFormatted, options, "Dirty");
            formatter.printAtlasLikeOutputForProcess(process, list);
            formatter.end();
        });
        return printed.out;
    };
    EXPECT_EQ(listing(0, regions), narrow + "\n");
    EXPECT_EQ(listing(HXTextWired | HXTextSwapped | HXTextWide, regions), wide + "\n");
}

// Twenty processes are named, twenty-one are only counted.
TEST(HXOutputFormatterTextTest, NamesTheMembersOfSmallGroups) {
    for (const int count : {3, 20, 21}) {
        std::string machine, names;
        for (int pid = 1; pid <= count; pid++) {
            machine += "process  pid=" + std::to_string(pid + 10) + "  name=p\n" +
                       region(pid + 10, 0x4000, 0x4000, "object_id=7  share_mode=4  resident=1  dirtied=1");
            if (pid > 1) names += (pid > 2 ? ", p [" : " p [") + std::to_string(pid + 10) + "]";
        }
        const HXRun result = report(machine, {"-a"});
        const std::string line = count <= 20 ? "Shared with" + names + ":\n" : "Shared with 21 processes:\n";
        EXPECT_NE(result.out.find("\n" + line), std::string::npos) << count << result.out;
        EXPECT_NE(result.out.find("Summary Heft: 16384 B\n"), std::string::npos);
    }
}

TEST(HXOutputFormatterTextTest, TellsWarningsAndErrors) {
    const HXRun result = run(R"(process  pid=10  name=fails  heft=5000
region  pid=10  address=0x4000  size=0x4000  resident=1  dirtied=1  object_id=1
fault  pid=10  call=mach_vm_region_recurse  from=2  error=5
process  pid=20  name=exits
region  pid=20  address=0x4000  size=0x4000  resident=1  dirtied=1  object_id=2
fault  pid=20  call=mach_vm_region_recurse  from=2  error=0x10000003  becomes=gone
process  pid=30  name=refuses  task_error=5
)",
                             {"10", "20", "30", "-f", "bytes"});
    EXPECT_EQ(result.status, 0);
    EXPECT_EQ(result.out, &R"(
======================================================================
exits [20]: 64-bit
Warnings were encountered while examining the process.
	exits [20]: (ipc/send) invalid destination port (process exited)
	Heft: 16384 B (16384 bytes per page)
======================================================================

      Dirty         Clean   Reclaimable    Regions    Category
        ---           ---           ---        ---    ---
    16384 B           0 B           0 B          1    untagged ("VM_ALLOCATE")
        ---           ---           ---        ---    ---
    16384 B           0 B           0 B          1    TOTAL

======================================================================
fails [10]: 64-bit
Errors were encountered while examining the process. No results gathered.
	fails [10]: (os/kern) failure
======================================================================

      Dirty         Clean   Reclaimable    Regions    Category
        ---           ---           ---        ---    ---
        ---           ---           ---        ---    ---
        0 B           0 B           0 B          0    TOTAL

Auxiliary data:
	phys_heft: 5000 B
	phys_heft_peak: 0 B


Warnings were encountered while examining the following processes:
	exits

Errors were encountered while examining the following processes:
	fails

Errors were encountered:
	task_for_pid [30] (os/kern) failure

Due to errors, summary results may be invalid
VM Object Dirty Analysis: Enabled
======================================================================
Summary Heft: 32768 B (may be invalid due to errors)
======================================================================

      Dirty         Clean   Reclaimable    Regions    Category
        ---           ---           ---        ---    ---
    32768 B           0 B           0 B          2    untagged ("VM_ALLOCATE")
        ---           ---           ---        ---    ---
    32768 B           0 B           0 B          2    TOTAL

)"[1]);
    std::vector<std::string> lines;
    std::istringstream text(result.err);
    for (std::string line; std::getline(text, line);)
        lines.push_back(line);
    std::sort(lines.begin(), lines.end()); // two processes are gathered at once
    EXPECT_EQ(lines, (std::vector<std::string>{"Unable to analyze process with pid 30 (try as root?)",
                                               "bailing out for process exits [20]; data may be incomplete!",
                                               "bailing out for process fails [10]; data may be incomplete!",
                                               "mach_vm_region_recurse: (ipc/send) invalid destination port",
                                               "mach_vm_region_recurse: (os/kern) failure",
                                               "task_for_pid: (os/kern) failure"}));
}
