#include "support/HXHostCalls.h"

#include "support/HXPages.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <sstream>

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
    std::vector<int32_t> dispositions;
    const kern_return_t error = HXPagesOf(host, task, address, bytes, &dispositions);
    if (error != KERN_SUCCESS) return host.mach_error_string(error);
    std::ostringstream text;
    const char *separator = "";
    for (const int32_t disposition : dispositions)
        text << std::exchange(separator, " ") << std::hex << disposition;
    return text.str();
}
