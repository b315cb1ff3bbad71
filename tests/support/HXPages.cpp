#include "support/HXPages.h"

#include <gtest/gtest.h>

kern_return_t HXPagesOf(HXPlatform &host, mach_port_t task, uint64_t address, uint64_t bytes,
                        std::vector<int32_t> *dispositions) {
    const uint64_t pageSize = host.vm_kernel_page_size(), first = address / pageSize;
    const uint64_t pages = (address % pageSize + bytes + pageSize - 1) / pageSize;
    std::vector<vm_page_run> runs;
    for (uint64_t told = 0; dispositions->size() < pages;) {
        const uint64_t done = dispositions->size(), start = (first + done) * pageSize;
        const kern_return_t error =
            host.mach_vm_page_range_query(task, start, (pages - done) * pageSize, &runs, &told);
        if (error != KERN_SUCCESS) return error;
        EXPECT_TRUE(told > 0 && told <= pages - done);
        EXPECT_TRUE(done + told == pages || told % HXPlatform::kPageQueryPages == 0) << told;
        dispositions->resize(done + told);
        uint64_t end = start;
        for (const vm_page_run &run : runs) {
            EXPECT_TRUE(run.address >= end && run.pages > 0 && run.disposition != 0);
            end = run.end(pageSize);
            for (uint64_t i = 0; i < run.pages; i++)
                dispositions->at(run.address / pageSize - first + i) = run.disposition;
        }
    }
    return KERN_SUCCESS;
}
