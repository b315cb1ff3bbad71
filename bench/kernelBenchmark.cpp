// Reading the kernel's own memory record, beside reading the files that it is made from. Needs root.
#include "platform/linux/HXLinuxPlatform.h"
#include "platform/linux/procfs/HXProcFile.h"

#include <benchmark/benchmark.h>

#include <fcntl.h>

namespace {

void readKernelFiles(benchmark::State &state) {
    for (auto _ : state)
        for (const char *path :
             {"/proc/slabinfo", "/proc/vmallocinfo", "/proc/meminfo", "/proc/zoneinfo", "/proc/modules"})
            benchmark::DoNotOptimize(HXReadText(AT_FDCWD, path));
}
BENCHMARK(readKernelFiles)->Unit(benchmark::kMillisecond);

void readKernelRecord(benchmark::State &state) {
    HXLinuxPlatform platform;
    for (auto _ : state) {
        mach_zone_name *names = nullptr;
        mach_zone_info *zones = nullptr;
        mach_memory_info_record *records = nullptr;
        uint32_t nameCount = 0;
        uint32_t zoneCount = 0;
        uint32_t recordCount = 0;
        if (platform.mach_memory_info(platform.mach_host_self(), &names, &nameCount, &zones, &zoneCount,
                                      &records, &recordCount) != KERN_SUCCESS)
            return state.SkipWithError("needs root");
        platform.vm_deallocate(platform.mach_task_self(), names, uint64_t{nameCount} * sizeof *names);
        platform.vm_deallocate(platform.mach_task_self(), zones, uint64_t{zoneCount} * sizeof *zones);
        platform.vm_deallocate(platform.mach_task_self(), records, uint64_t{recordCount} * sizeof *records);
    }
}
BENCHMARK(readKernelRecord)->Unit(benchmark::kMillisecond);

} // namespace
