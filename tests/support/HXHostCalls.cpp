#include "support/HXHostCalls.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <sstream>
#include <utility>
#include <vector>

mach_port_t HXTaskOf(HXPlatform &host, int32_t pid) {
    mach_port_t task = 0;
    EXPECT_EQ(host.task_for_pid(host.mach_task_self(), pid, &task), KERN_SUCCESS) << pid;
    return task;
}

std::string HXRegionAt(HXPlatform &host, mach_port_t task, uint64_t address, vm_region_submap_info_64 *info,
                       uint32_t words) {
    const uint32_t filled =
        std::min(words, info ? VM_REGION_SUBMAP_INFO_COUNT_64 : VM_REGION_BASIC_INFO_COUNT_64);
    uint64_t size = 0;
    uint32_t depth = UINT32_MAX;
    vm_region_basic_info_64 basic;
    const kern_return_t error =
        info ? host.mach_vm_region_recurse(task, &address, &size, &depth, info, &words)
             : host.mach_vm_region(task, &address, &size, VM_REGION_BASIC_INFO_64, &basic, &words);
    if (error != KERN_SUCCESS) return host.mach_error_string(error);
    EXPECT_EQ(depth, info ? 0 : UINT32_MAX);
    EXPECT_EQ(words, filled);
    std::ostringstream text;
    text << std::hex << address << "+" << size;
    return text.str();
}

std::string HXPagesAt(HXPlatform &host, mach_port_t task, uint64_t address, uint64_t bytes) {
    const uint64_t pageSize = host.vm_kernel_page_size(), first = address / pageSize;
    const uint64_t pages = (address % pageSize + bytes + pageSize - 1) / pageSize;
    std::ostringstream text;
    const char *separator = "";
    std::vector<vm_page_run> runs;
    for (uint64_t done = 0, told = 0; done < pages; done += told) {
        const uint64_t start = (first + done) * pageSize;
        const kern_return_t error =
            host.mach_vm_page_range_query(task, start, (pages - done) * pageSize, &runs, &told);
        if (error != KERN_SUCCESS) return host.mach_error_string(error);
        EXPECT_TRUE(told > 0 && told <= pages - done);
        EXPECT_TRUE(done + told == pages || told % HXPlatform::kPageQueryPages == 0) << told;
        std::vector<int32_t> dispositions(told);
        uint64_t end = start;
        for (const vm_page_run &run : runs) {
            EXPECT_TRUE(run.address >= end && run.pages > 0 && run.disposition != 0);
            end = run.end(pageSize);
            for (uint64_t i = 0; i < run.pages; i++)
                dispositions.at(run.address / pageSize - first - done + i) = run.disposition;
        }
        for (const int32_t disposition : dispositions)
            text << std::exchange(separator, " ") << std::hex << disposition;
    }
    return text.str();
}
