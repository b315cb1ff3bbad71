// What breaks the form of machine files, with the line that the load fails at.
#include "platform/capture/HXMachine.h"
#include "platform/linux/HXLinuxServices.h"
#include "support/HXBuilders.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <fstream>

namespace {

// The file's text, with a bar for each TAB.
std::string file(std::string records) {
    std::replace(records.begin(), records.end(), '|', '\t');
    return "heft-machine 1\n" + records;
}

std::string reasonFor(const std::string &text) {
    std::string reason;
    const bool loaded = HXMachine::loadText(text, &reason) != nullptr;
    EXPECT_EQ(loaded, reason.empty());
    return reason;
}

TEST(HXMachineReader, NamesTheLineThatBreaksTheForm) {
    const std::string process = "process|pid=1\n";
    const std::string region = process + "region|pid=1|address=0x8000|size=0x8000";
    const std::pair<std::string, const char *> cases[] = {
        // records, and how the reason begins
        {"", ""},
        {"zone|name=tab\\tnewline\\nslash\\\\\n", ""},
        {"host|page_size=4096\n" + process + "region|pid=1|address=4096|size=4096|pages=1*0x10\n", ""},
        {"\n# x|x=\n\nprocesses|pid=1\n", "line 5: unknown record \"processes\""},
        {"|pid=1\n", "line 2: unknown record \"\""},
        {"process|pid=1|size=1\n", "line 2: unknown field \"size\""},
        {"process|pid=1|pid=1\n", "line 2: twice the field \"pid\""},
        {"process|ppid=1\n", "line 2: missing field \"pid\""},
        {"process|pid=\n", "line 2: pid is no number"},
        {"process|pid=0x-1\n", "line 2: pid is no number"},
        {"process|pid=2147483648\n", "line 2: pid is no number"},
        {"process|pid=-2147483648\n", ""},
        {"process|pid=1|heft=18446744073709551616\n", "line 2: heft is no number"},
        {"process|pid=1|listed=2\n", "line 2: listed is not 0 or 1"},
        {"process|pid=1|comm=a\\xb\n", "line 2: a bad escape in comm"},
        {region + "|pager=256\n", "line 3: pager is no number"},
        {process + process, "line 3: a second process record of pid 1"},
        {process + "host|pid=2\n", "line 3: the host record comes after"},
        {"host|page_size=5000\n", "line 2: page_size"},
        {region + "\nregion|pid=1|address=0xc000|size=0x4000\n", "line 4: it overlaps"},
        {process + "region|pid=1|address=0x8000|size=0\n", "line 3: a length of 0"},
        {process + "region|pid=1|address=0x8000|size=0x1000\n", "line 3: address or size is no multiple"},
        {process + "region|pid=1|address=0|size=0x200000000004000\n", "line 3: it is longer than 2^57"},
        {process + "region|pid=1|address=0xffffffffffffc000|size=0x4000\n", "line 3: it ends beyond"},
        {process + "region|pid=1|address=0xffffffffffff8000|size=0x4000\n", ""},
        {process + "top|pid=1|address=0x4000|size=0x4000\ntop|pid=1|address=0x4000|size=0x4000\n",
         "line 4: it overlaps"},
        {process + "segment|pid=1|name=__TEXT|start=0|size=1\n", "line 3: a segment before an image"},
        {process + "image|pid=1|path=x|base=0\nsegment|pid=1|name=x|start=1|size=0\n",
         "line 4: a length of 0"},
        {region + "|pages=18446744073709551615*1\n", "line 3: more pages"},
        {region + "|pages=0*1\n", "line 3: a bad run of pages"},
        {region + "|pages=1*1,\n", "line 3: a bad run of pages"},
        {region + "|pages=1*9\npages|pid=1|pages=1*8\n", ""},
        {region + "|pages=1*9\npages|pid=1|pages=2*8\n", "line 4: more pages"},
        {region + "\npages|pid=1|pages=2*8\n", "line 4: pages that do not continue"},
        {process + "region|pid=1|address=0|size=0x1000004000|pages=1*1\n",
         "line 3: pages on a region of more"},
        {"process|pid=1|owned_none=1\nowned|pid=1|object_id=1\n", "line 3: an owned object"},
        {process + "fault|pid=1|call=mach_vm_region|error=0\n", "line 3: a fault with error 0"},
        {process + "fault|pid=1|call=mach_vm|error=1\n", "line 3: unknown call \"mach_vm\""},
        {"symbol|address=16|size=16\nsymbol|address=0|size=0xffffffffffffffff\n", "line 3: a symbol that"},
        {"symbol|address=16|size=16\nsymbol|address=8|size=8\nsymbol|address=32|size=1\n", ""},
        {"tag|tag=110|name=a\ntag|tag=110|name=a\n", "line 3: a second record of tag 110"},
        {"zone|name=" + std::string((1 << 20) - 10, 'x'), ""},
        {"\nzone|name=" + std::string((1 << 20) - 9, 'x'), "line 3: the record is longer than 1 MiB"},
    };
    for (const auto &[records, beginning] : cases) {
        const std::string reason = reasonFor(file(records)), expected = beginning;
        EXPECT_EQ(reason.substr(0, expected.empty() ? reason.size() : expected.size()), expected)
            << records.substr(0, 200) << ": " << reason;
    }
    for (const char *record :
         {"region|address=0|size=0x4000", "top|address=0|size=0x4000", "pages|pages=", "image|path=x|base=0",
          "segment|name=x|start=0|size=1", "owned|object_id=1", "fault|call=mach_vm_region|error=1"})
        EXPECT_EQ(reasonFor(file("process|pid=2\n" + std::string(record) + "|pid=1\n")),
                  "line 3: no process record before this one for pid 1")
            << record;
    for (const char *text : {"", "heft-machine 2\n", "heft-machine 1 \n", "# x\nheft-machine 1\n"})
        EXPECT_EQ(reasonFor(text), "not a machine file") << text;
    EXPECT_EQ(reasonFor("heft-machine 1"), "");
}

// Records lie anywhere across the pieces in which a file is read.
TEST(HXMachineReader, ReadsFilesInPiecesAsItReadsText) {
    HXLinuxServices services;
    std::string reason;
    const auto load = [&](const std::string &text) {
        const std::string path = temporaryPath();
        std::ofstream(path) << text;
        return HXMachine::load(services, path, &reason);
    };
    const auto pathOf = [](uint64_t i) { return "/" + std::string(i % 89, 'p') + std::to_string(i % 10); };
    constexpr uint64_t regions = 5000;
    std::string text = file("process|pid=7\n");
    for (uint64_t i = 1; i <= regions; i++) {
        text += "#" + std::string(i % 1000 == 0 ? i * 100 : i % 97, 'c') +
                "\nregion\tpid=7\taddress=" + std::to_string(i << 14) + "\tsize=16384\tpath=" + pathOf(i) +
                "\n";
    }
    const auto machine = load(text);
    ASSERT_TRUE(machine) << reason;
    const auto &read = *machine->process(7)->regions;
    ASSERT_EQ(read.size(), regions);
    for (uint64_t i = 1; i <= regions; i++) {
        EXPECT_EQ(read[i - 1].address, i << 14);
        EXPECT_EQ(machine->strings.text(read[i - 1].path), pathOf(i));
    }
    const std::string large(40 << 20, 'x');
    const std::pair<std::string, const char *> broken[] = {
        {text + "x\n", "line 10003: unknown record \"x\""},
        {text + "zone\tname=" + large, "line 10003: the record is longer than 1 MiB"},
        {text + "#" + large + "\nx", "line 10004: unknown record \"x\""},
        {large, "not a machine file"},
    };
    for (const auto &[content, expected] : broken) {
        EXPECT_FALSE(load(content));
        EXPECT_EQ(reason, expected);
    }
    EXPECT_FALSE(HXMachine::load(services, "/nonexistent/machine", &reason));
    EXPECT_EQ(reason, "No such file or directory");
}

} // namespace
