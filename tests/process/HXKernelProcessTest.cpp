#include "process/HXKernelProcess.h"
#include "process/HXProcessSnapshot.h"

#include "support/HXBuilders.h"
#include "support/HXMadeUpMachine.h"

#include <gtest/gtest.h>
#include <sstream>

namespace {
using Lines = std::vector<std::string>;

// The kernel of a machine, gathered: #OBJECT, NAME and DETAIL, its sizes as dDIRTY cCLEAN rRECLAIMABLE (none
// when 0) of the whole, and whether it is wired.
struct Gathered {
    Lines regions, errors;
    std::string aux, err;
};
Gathered gather(const std::string &records, const std::string &hostFields = "") {
    const HXMadeUpMachine machine("host  self_region_heft=1" + hostFields + "\n" + records);
    proc_bsdinfo info{};
    info.pbi_flags = PROC_FLAG_SYSTEM | PROC_FLAG_LP64;
    info.pbi_comm[0] = 'k';
    HXProcessSnapshot snapshot;
    const auto kernel = HXProcess::processWithBsdInfo(info, snapshot);
    EXPECT_EQ(kernel->displayString(), "k [0]");
    EXPECT_EQ(kernel->idleExitStatus(), HXIdleExitNotSupported);
    Gathered gathered;
    gathered.err = printedBy([&] { kernel->gatherData(); }).err;
    for (const HXMemoryRegion &region : kernel->memoryRegions()) {
        std::ostringstream line;
        line << '#' << std::hex << region.object_id() << ' ' << region.fullName() << std::dec;
        for (const auto &[title, bytes] : {std::pair{" d", region.dirtySize()},
                                           {" c", region.cleanNonSpecSize()},
                                           {" r", region.reclaimableSize()}})
            if (bytes != 0) line << title << bytes;
        line << " of " << region.size() << (region.wired() ? " wired" : "");
        gathered.regions.push_back(line.str());
    }
    gathered.errors = kernel->errors();
    gathered.aux = kernel->auxData()->jsonRepresentation();
    EXPECT_EQ(kernel->auxData()->mergeWithData(nullptr), nullptr); // no figure of it adds to another's
    return gathered;
}
const std::string k80(80, 'n');
} // namespace

TEST(HXKernelProcessTest, ChargesZonesByTheirElements) {
    const auto zone = [](const std::string &name, const char *facts) {
        return "zone  name=" + name + "  " + facts + "\n";
    };
    EXPECT_EQ(gather(zone("plain", "count=10  cur_size=1000  elem_size=64") +
                     zone("collectable", "count=10  cur_size=1000  elem_size=64  collectable=1") +
                     zone(k80, "count=0  cur_size=1000  elem_size=64  collectable=7") +
                     zone("outgrown", "count=10  cur_size=639  elem_size=64  collectable=1") +
                     zone("wrapped", "count=0x1000000000000000  cur_size=1000  elem_size=16  collectable=1"))
                  .regions,
              (Lines{"#200000000 plain zone d1000 of 1000", "#200000001 collectable zone d640 r360 of 1000",
                     "#200000002 " + k80 + " zone r1000 of 1000", "#200000003 outgrown zone d640 of 639",
                     "#200000004 wrapped zone of 1000"}));
}

TEST(HXKernelProcessTest, NamesAndChargesSites) {
    // Flags: the type (0 tag, 1 module, 2 code, 3 counter), 0x100 wired, 0x200 hidden, 0x400 named, 0x800 in
    // a zone.
    static_assert(VM_KERN_SITE_WIRED == 0x100 && VM_KERN_SITE_HIDE == 0x200 && VM_KERN_SITE_NAMED == 0x400 &&
                  VM_KERN_SITE_ZONE == 0x800);
    const std::string known = "site=0xffffff8000100000  size=9";
    const struct {
        std::string site, line;
    } cases[] = {
        {"flags=0x100  site=0  size=9", "#300000000 VM_KERN_MEMORY_NONE d9 of 9 wired"},
        {"flags=0x100  site=28  size=9", "#30000001c VM_KERN_MEMORY_FIRST_DYNAMIC d9 of 9 wired"},
        {"flags=0x100  site=29  size=9", "#30000001d VM_KERN_MEMORY_29 d9 of 9 wired"},
        {"flags=0x100  site=255  size=9", "#3000000ff VM_KERN_MEMORY_ANY d9 of 9 wired"},
        {"flags=0x100  site=0x10000000000", "#10300000000 VM_KERN_MEMORY_1099511627776 of 0 wired"},
        {"flags=0x101  site=7  size=9", "#500000007 com.second d9 of 9 wired"},
        {"flags=0x101  site=8  size=9", "#500000008 unloaded kmod 8 d9 of 9 wired"},
        {"flags=0x101  site=9  size=9", "#500000009 unloaded kmod 9 d9 of 9 wired"},
        {"flags=0x102  site=0  size=9", "#100000000 site 0x0 d9 of 9 wired"},
        {"flags=0x102  " + known, "#ffffff8100100000 known_function (kern/known.c:42) d9 of 9 wired"},
        {"flags=0x102  site=0x200  size=9", "#100000200 site 0x200 d9 of 9 wired"},
        {"flags=0x103  site=2  size=9", "#400000002 VM_KERN_COUNT_WIRED d9 of 9 wired"}, // wired: a site
        {"flags=0x104  site=0x1f  size=9", "#10000001f unknown site (0x4, 0x1f) d9 of 9 wired"},
        {"flags=0x500  site=13  size=9  name=" + k80, "#30000000d " + k80 + " d9 of 9 wired"},
        {"flags=0x502  name=given  " + known, "#ffffff8100100000 given (kern/known.c:42) d9 of 9 wired"},
        {"flags=0x900  site=13  size=9", "#30000000d VM_KERN_MEMORY_KALLOC[zone.0] c9 of 9 wired"},
        {"flags=0xd00  site=13  size=9  name=given  zone=1", "#30000000d given[" + k80 + "] c9 of 9 wired"},
        {"flags=0x900  site=13  size=9  zone=2", "#30000000d VM_KERN_MEMORY_KALLOC c9 of 9 wired"},
        {"flags=0  site=13  size=9", "#30000000d VM_KERN_MEMORY_KALLOC c9 of 9"},
        {"flags=0x300  site=13  size=9", "#30000000d VM_KERN_MEMORY_KALLOC (hidden) c9 of 9 wired"},
        {"flags=0x100  site=24  size=9", "#300000018 VM_KERN_MEMORY_MLOCK (user wired) c9 of 9 wired"},
        {"flags=0x300  site=24  size=9", "#300000018 VM_KERN_MEMORY_MLOCK (hidden) c9 of 9 wired"},
        {"flags=0x101  site=24  size=9", "#500000018 unloaded kmod 24 (user wired) c9 of 9 wired"},
    };
    for (const auto &test : cases) {
        const Gathered gathered = gather("zone  name=zone.0\nzone  name=" + k80 +
                                         "\nkext  load_tag=7  bundle_id=com.first\nkext  load_tag=8\n"
                                         "kext  load_tag=7  bundle_id=com.second\n"
                                         "symbol  address=0xffffff8000100000  size=1  name=known_function  "
                                         "path=kern/known.c  line=42\nsite  " +
                                         test.site + "\n");
        EXPECT_EQ(gathered.regions.back(), test.line);
        EXPECT_EQ(gathered.regions.size(), 3u);
    }
}

TEST(HXKernelProcessTest, CountersAreAuxiliaryDataAndEmptyRecordsNothing) {
    const Gathered gathered = gather("site  flags=3  site=0  mapped=100\n"
                                     "site  flags=3  site=0  size=5\n" // nothing mapped, whatever its size
                                     "site  flags=3  site=2  mapped=200\n"
                                     "site  flags=0x203  site=2  mapped=300\n" // replaces the one before
                                     "site  flags=3  site=11  mapped=2\nsite  flags=3  site=4\n"
                                     "site  flags=0x100  site=0  mapped=7\n" // a site counts by its size
                                     "site  flags=0x100  site=5\n");
    EXPECT_EQ(gathered.aux, R"({"Maps":{"VM_KERN_COUNT_MANAGED":100,"VM_KERN_COUNT_WIRED":300,)"
                            R"("VM_KERN_COUNT_11":2,"VM_KERN_COUNT_STOLEN":0}})");
    EXPECT_EQ(gathered.regions, Lines{"#300000005 VM_KERN_MEMORY_OSKEXT of 0 wired"});
}

TEST(HXKernelProcessTest, AKernelThatRefusesIsAnError) {
    const Gathered gathered = gather("zone  name=z  cur_size=1\n", "  memory_info_error=8");
    EXPECT_EQ(gathered.err, "k [0]: mach_memory_info: (os/kern) no access\n");
    EXPECT_EQ(gathered.errors, Lines{"k [0]: (os/kern) no access"});
    EXPECT_EQ(gathered.regions, Lines{});
}
