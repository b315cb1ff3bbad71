// The steps after gathering, over made-up processes: merging, sharing, both formatters; and the range list.
#include "analysis/HXHeft.h"
#include "model/HXRangeList.h"
#include "output/HXOutputFormatterJSON.h"
#include "output/HXOutputFormatterText.h"
#include "platform/linux/HXLinuxPlatform.h"

#include <benchmark/benchmark.h>

#include <algorithm>
#include <random>

namespace {

constexpr uint32_t kPage = 4096;

// A process of `own` regions of its own and one of each of `shared` objects.
class MadeUpProcess : public HXProcess {
  public:
    MadeUpProcess(int32_t pid, uint64_t own, uint64_t shared) {
        static const HXString heap = HXString::intern("heap");
        static const HXString memory = HXString::intern("shared anonymous");
        setPid(pid);
        setIs64bit(true);
        setPageSize(kPage);
        setName("worker");
        setDisplayString("worker [" + std::to_string(pid) + "]");
        for (uint64_t i = 0; i < own + shared; i++) {
            HXMemoryRegion &region = _memoryRegions.emplace_back();
            const bool isShared = i < shared;
            region.setStart(0x10000 + i * 32 * kPage);
            region.setSize(16 * kPage);
            region.setDirtySize(isShared ? 16 * kPage : (i % 16) * kPage);
            region.setName(isShared ? memory : heap);
            region.setShare_mode(isShared ? SM_SHARED : SM_PRIVATE);
            region.setSegment(HXSegmentNoImage);
            region.setObject_id(isShared ? i + 1 : (uint64_t{static_cast<uint32_t>(pid)} << 32) + i + 1);
        }
    }
};

void usePlatform() {
    static HXLinuxPlatform platform;
    static const bool once = [] {
        HXPlatform::setCurrent(&platform);
        HXHeft::setBreakDownPhysHeft(true);
        return true;
    }();
    (void)once;
}

HXHeft::ProcessList makeProcesses(int64_t processes, int64_t own, int64_t shared) {
    HXHeft::ProcessList list;
    for (int64_t i = 0; i < processes; i++)
        list.push_back(std::make_unique<MadeUpProcess>(static_cast<int32_t>(i + 1), own, shared));
    return list;
}

void countRegions(benchmark::State &state) {
    state.SetItemsProcessed(state.iterations() * state.range(0) * (state.range(1) + state.range(2)));
}

// Arguments: processes, own regions, shared objects.
void shapes(benchmark::internal::Benchmark *benchmark) {
    benchmark->Args({200, 400, 100})
        ->Args({2000, 400, 100})
        ->Args({1, 1000000, 0})
        ->Args({50, 0, 100})
        ->Args({5000, 0, 100});
    benchmark->Unit(benchmark::kMillisecond)->Iterations(3);
}

void merge(benchmark::State &state) {
    usePlatform();
    for (auto _ : state) {
        state.PauseTiming();
        auto heft = std::make_unique<HXHeft>(makeProcesses(state.range(0), state.range(1), state.range(2)));
        state.ResumeTiming();
        heft->gatherData();
        state.PauseTiming();
        heft.reset();
        state.ResumeTiming();
    }
    countRegions(state);
}
BENCHMARK(merge)->Apply(shapes);

void analyseSharing(benchmark::State &state) {
    usePlatform();
    HXHeft heft(makeProcesses(state.range(0), state.range(1), state.range(2)));
    heft.gatherData();
    for (auto _ : state)
        benchmark::DoNotOptimize(heft._sharingData());
    countRegions(state);
}
BENCHMARK(analyseSharing)->Apply(shapes);

void report(benchmark::State &state, const char *format, bool verbose) {
    usePlatform();
    std::FILE *null = std::fopen("/dev/null", "w");
    for (auto _ : state) {
        state.PauseTiming();
        auto heft = std::make_unique<HXHeft>(makeProcesses(state.range(0), state.range(1), state.range(2)));
        heft->gatherData();
        HXOutputFormatterText text(HXFormatFormatted, 0, "Dirty");
        text.setOutput(null);
        const auto json = HXOutputFormatterJSON::withPath("/dev/null");
        if (std::string_view(format) == "text")
            heft->addOutputFormatter(text);
        else
            heft->addOutputFormatter(*json);
        state.ResumeTiming();
        heft->printOutputVerbose(verbose, !verbose);
        state.PauseTiming();
        heft.reset();
        state.ResumeTiming();
    }
    std::fclose(null);
    countRegions(state);
}
BENCHMARK_CAPTURE(report, text, "text", false)->Apply(shapes);
BENCHMARK_CAPTURE(report, json, "json", false)->Apply(shapes);
BENCHMARK_CAPTURE(report, textWithRegions, "text", true)
    ->Args({200, 400, 100})
    ->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(report, jsonWithRegions, "json", true)
    ->Args({200, 400, 100})
    ->Unit(benchmark::kMillisecond);

enum Order { ascending, descending, random };

void addRanges(benchmark::State &state) {
    std::vector<uint64_t> pages(static_cast<size_t>(state.range(0)));
    for (size_t i = 0; i < pages.size(); i++)
        pages[i] = 2 * (state.range(1) == descending ? pages.size() - i : i);
    if (state.range(1) == random) std::shuffle(pages.begin(), pages.end(), std::mt19937(1));
    for (auto _ : state) {
        HXRangeList list;
        for (const uint64_t page : pages)
            list.addRange({page * kPage, kPage}, kPage, {.dirty = kPage});
        benchmark::DoNotOptimize(list.sum());
    }
    state.SetItemsProcessed(state.iterations() * state.range(0));
}
BENCHMARK(addRanges)->ArgsProduct({{1000, 10000, 100000}, {ascending, descending, random}});

} // namespace
