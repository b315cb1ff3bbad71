// The parsers: an address space as the kernel prints it, and a machine file.
#include "platform/capture/HXMachine.h"
#include "platform/linux/procfs/HXMapsParser.h"
#include "platform/linux/procfs/HXProcText.h"

#include <benchmark/benchmark.h>

#include <string>

namespace {

// `count` mappings, each with the lines of smaps.
std::string smapsText(int64_t count) {
    std::string text;
    for (int64_t i = 0; i < count; i++) {
        char line[128];
        snprintf(line, sizeof line,
                 "%012llx-%012llx rw-p 00000000 fe:00 %lld                   /usr/lib/libfoo%lld.so\n",
                 static_cast<unsigned long long>(0x7f0000000000 + i * 0x4000),
                 static_cast<unsigned long long>(0x7f0000002000 + i * 0x4000),
                 static_cast<long long>(i / 4 + 1), static_cast<long long>(i / 4));
        text += line;
        text += "Size:                  8 kB\nKernelPageSize:        4 kB\nMMUPageSize:           4 kB\n"
                "Rss:                   8 kB\nPss:                   4 kB\nPss_Dirty:             4 kB\n"
                "Shared_Clean:          4 kB\nShared_Dirty:          0 kB\nPrivate_Clean:         0 kB\n"
                "Private_Dirty:         4 kB\nReferenced:            8 kB\nAnonymous:             4 kB\n"
                "KSM:                   0 kB\nLazyFree:              0 kB\nAnonHugePages:         0 kB\n"
                "ShmemPmdMapped:        0 kB\nFilePmdMapped:         0 kB\nShared_Hugetlb:        0 kB\n"
                "Private_Hugetlb:       0 kB\nSwap:                  0 kB\nSwapPss:               0 kB\n"
                "Locked:                0 kB\nTHPeligible:           0\nVmFlags: rd wr mr mw me \n";
    }
    return text;
}

void parseSmaps(benchmark::State &state) {
    const std::string content = smapsText(state.range(0));
    for (auto _ : state) {
        HXMapsParser parser(12);
        HXMapsEntry entry;
        std::string_view text = content;
        while (parser.next(&text, true, &entry))
            benchmark::DoNotOptimize(entry);
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(parseSmaps)->Arg(100)->Arg(20000);

void parseStatus(benchmark::State &state) {
    const std::string_view text =
        "Name:\tcat\nState:\tR (running)\nPPid:\t1\nGroups:\t \nVmHWM:\t    1684 kB\nVmRSS:\t    1684 kB\n"
        "RssAnon:\t     116 kB\nRssFile:\t    1568 kB\nRssShmem:\t       0 kB\nVmPTE:\t      40 kB\n"
        "VmSwap:\t       0 kB\nHugetlbPages:\t       0 kB\nThreads:\t1\n";
    for (auto _ : state)
        benchmark::DoNotOptimize(HXParseStatus(text));
}
BENCHMARK(parseStatus);

void loadMachine(benchmark::State &state) {
    std::string text = "heft-machine 1\nhost\tpage_size=4096\nprocess\tpid=1\tcomm=worker\n";
    for (int64_t i = 0; i < state.range(0); i++)
        text += "region\tpid=1\taddress=" + std::to_string((i + 1) * 0x20000) +
                "\tsize=65536\tresident=16\tdirtied=7\ttag=101\tfull_object_id=" + std::to_string(i + 1) +
                "\n";
    for (auto _ : state) {
        std::string reason;
        benchmark::DoNotOptimize(HXMachine::loadText(text, &reason));
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(loadMachine)->Arg(1000)->Arg(100000)->Arg(1000000)->Unit(benchmark::kMillisecond);

} // namespace
