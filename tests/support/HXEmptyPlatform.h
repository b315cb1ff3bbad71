// A host that has nothing and fails every call, for tests that answer only the calls in question.
#pragma once

#include "platform/HXPlatform.h"

#include <cerrno>

class HXEmptyPlatform : public HXPlatform {
  public:
    mach_port_t mach_task_self() override { return 1; }
    kern_return_t task_for_pid(mach_port_t, int32_t, mach_port_t *) override { return KERN_FAILURE; }
    void mach_port_deallocate(mach_port_t, mach_port_t) override {}
    kern_return_t mach_vm_region(mach_port_t, uint64_t *, uint64_t *, int32_t, vm_region_basic_info_64 *,
                                 uint32_t *) override {
        return KERN_INVALID_ADDRESS;
    }
    kern_return_t mach_vm_region_recurse(mach_port_t, uint64_t *, uint64_t *, uint32_t *,
                                         vm_region_submap_info_64 *, uint32_t *) override {
        return KERN_INVALID_ADDRESS;
    }
    kern_return_t mach_vm_page_range_query(mach_port_t, uint64_t, uint64_t, int32_t *, uint64_t *) override {
        return KERN_INVALID_ADDRESS;
    }
    kern_return_t mach_vm_purgable_control(mach_port_t, uint64_t, int32_t, int32_t *) override {
        return KERN_INVALID_ARGUMENT;
    }
    uint32_t vm_kernel_page_size() override { return 4096; }
    bool hasSharedRegion() override { return false; }

    int32_t proc_listallpids(int32_t *, uint32_t) override { return missing(); }
    int32_t proc_pidinfo(int32_t, int32_t, uint64_t, void *, uint32_t) override { return 0; }
    int32_t proc_pid_rusage(int32_t, int32_t, rusage_info_v4 *) override { return missing(); }
    int32_t proc_get_dirty(int32_t, uint32_t *) override { return missing(); }
    int32_t proc_regionfilename(int32_t, uint64_t, char *, uint32_t) override { return 0; }
    int32_t getpid() override { return 1; }
    uint32_t geteuid() override { return 0; }
    int32_t sysctl(const int32_t *, uint32_t, void *, size_t *) override { return missing(); }
    int32_t sysctlbyname(const char *, void *, size_t *, const void *, size_t) override { return missing(); }
    int32_t ledger(int32_t, int32_t, void *, int64_t *) override { return missing(); }

    RVSymbolicator *RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t, uint32_t,
                                                                     const void *) override {
        return nullptr;
    }
    void RVSymbolicatorForeachSymbolOwnerAtTime(RVSymbolicator *, uint64_t,
                                                const std::function<void(const RVSymbolOwner &)> &) override {
    }
    std::string stringByResolvingSymlinksInPath(const std::string &path) override { return path; }
    RVSymbolicator *RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t, const void *) override {
        return nullptr;
    }
    RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *, uint64_t, uint64_t) override {
        return {nullptr};
    }
    RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *, uint64_t, uint64_t) override {
        return {nullptr, 0, true};
    }
    void RVRelease(RVSymbolicator *) override {}

    mach_port_t mach_host_self() override { return 2; }
    kern_return_t mach_memory_info(mach_port_t, mach_zone_name **, uint32_t *, mach_zone_info **, uint32_t *,
                                   mach_memory_info_record **, uint32_t *) override {
        return KERN_NO_ACCESS;
    }
    kern_return_t vm_deallocate(mach_port_t, const void *, uint64_t) override { return KERN_SUCCESS; }
    std::vector<OSKextInfo> OSKextCopyLoadedKextInfo() override { return {}; }
    std::optional<std::string> GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t, uint8_t, int32_t,
                                                                              uint8_t) override {
        return std::nullopt;
    }

    HXOptionScan getopt_long(int, char *const[], const char *, const std::vector<HXLongOption> &,
                             bool) override {
        return {-1, nullptr, 1};
    }
    bool stat(const std::string &) override { return false; }
    std::FILE *fopen(const std::string &, const char *) override { return nullptr; }
    std::optional<std::string> readFile(const std::string &, uint64_t) override { return std::nullopt; }
    std::optional<HXPendingFile> createPendingFile(const std::string &) override { return std::nullopt; }
    bool commitPendingFile(HXPendingFile &) override { return false; }
    void discardPendingFile(HXPendingFile &) override {}
    bool isatty(int) override { return false; }

    HXDispatchQueue dispatch_queue_create(const std::string &label, uint32_t qualityOfService) override {
        return {label, qualityOfService};
    }
    void dispatch_apply(size_t iterations, const HXDispatchQueue &,
                        const std::function<void(size_t)> &work) override {
        for (size_t i = 0; i < iterations; i++)
            work(i);
    }
    std::unique_ptr<HXDispatchSource> dispatch_source_create(int) override { return nullptr; }
    void dispatch_source_set_event_handler(HXDispatchSource &, std::function<void()>) override {}
    void dispatch_resume(HXDispatchSource &) override {}
    void dispatch_source_cancel(HXDispatchSource &) override {}
    void signal(int, HXSignalDisposition) override {}

  private:
    static int32_t missing() {
        errno = ENOENT;
        return -1;
    }
};
