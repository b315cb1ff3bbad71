// Fuzz target: any bytes as a machine file, and all questions to the machine that they make.
#include "platform/HXRegionTags.h"
#include "platform/linux/HXLinuxServices.h"
#include "platform/replay/HXReplayPlatform.h"

#include <cstdlib>

namespace {

void require(bool holds) {
    if (!holds) std::abort();
}

void askRegions(HXReplayPlatform &host, int32_t pid, mach_port_t task) {
    uint64_t address = 0, size = 0;
    for (size_t i = 0; i < 256; i++, address += size) {
        vm_region_submap_info_64 info{};
        uint32_t depth = UINT32_MAX, words = VM_REGION_SUBMAP_INFO_COUNT_64;
        const uint64_t asked = address;
        if (host.mach_vm_region_recurse(task, &address, &size, &depth, &info, &words) != KERN_SUCCESS) return;
        require(size > 0 && address + size > asked);
        std::vector<vm_page_run> runs;
        uint64_t pages = 0;
        if (host.mach_vm_page_range_query(task, address, size, &runs, &pages) == KERN_SUCCESS)
            require(pages * host.vm_kernel_page_size() <= size);
        for (const vm_page_run &run : runs)
            require(run.address >= address && run.end(host.vm_kernel_page_size()) <= address + size);
        char path[16];
        require(host.proc_regionfilename(pid, address, path, sizeof path) <= int32_t{sizeof path});
        vm_region_basic_info_64 basic{};
        words = VM_REGION_BASIC_INFO_COUNT_64;
        uint64_t top = address, topSize = 0;
        host.mach_vm_region(task, &top, &topSize, VM_REGION_BASIC_INFO_64, &basic, &words);
    }
}

void askProcess(HXReplayPlatform &host, int32_t pid) {
    proc_bsdinfo info{};
    host.proc_pidinfo(pid, PROC_PIDTBSDINFO, 0, &info, sizeof info);
    const int32_t name[] = {1, 49, pid};
    char area[64];
    size_t bytes = sizeof area;
    host.sysctl(name, 3, area, &bytes);
    require(bytes <= sizeof area);
    ledger_entry_info entries[2] = {};
    int64_t count = 2;
    host.ledger(LEDGER_ENTRY_INFO, pid, entries, &count);
    mach_port_t task = 0;
    if (host.task_for_pid(1, pid, &task) != KERN_SUCCESS) return;
    bytes = sizeof area;
    host.sysctlbyname("vm.get_owned_vmobjects", area, &bytes, &task, sizeof task);
    RVSymbolicator *const images = host.RVSymbolicatorCreateWithTaskFlagsAndNotification(task, 0, nullptr);
    host.RVSymbolicatorForeachSymbolOwnerAtTime(images, kRVNow, [](const RVSymbolOwner &image) {
        for (size_t i = 0; i < image.segmentCount; i++)
            require(image.segments[i].name != nullptr);
    });
    host.RVRelease(images);
    for (const int32_t setting : {0, 1}) {
        host.sysctlbyname("vm.self_region_heft", nullptr, nullptr, &setting, sizeof setting);
        askRegions(host, pid, task);
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    std::string reason;
    const auto machine = HXMachine::loadText({reinterpret_cast<const char *>(data), size}, &reason);
    require((machine != nullptr) == reason.empty());
    if (!machine) return 0;
    static HXLinuxServices services; // never asked
    HXReplayPlatform host(*machine, services);
    int32_t pids[16];
    const int32_t count = host.proc_listallpids(pids, sizeof pids);
    for (int32_t i = 0; i < count; i++)
        askProcess(host, pids[i]);
    return 0;
}
