// The live Linux host.
#pragma once

#include "platform/HXPlatform.h"
#include "platform/linux/HXLinuxServices.h"
#include "platform/linux/images/HXImageHeaders.h"
#include "platform/linux/kernel/HXLinuxKernelMemory.h"
#include "platform/linux/memory/HXFileSystems.h"
#include "platform/linux/memory/HXObjectIdentifiers.h"
#include "platform/linux/pages/HXLinuxTask.h"
#include "platform/linux/procfs/HXLinuxProcesses.h"
#include "platform/linux/sharing/HXHeldObjects.h"

#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>

class HXLinuxPlatform final : public HXPlatform {
  public:
    struct Setting {
        std::string procPath = "/proc";
        std::string sysPath = "/sys";
        // The device of the kernel's own tmpfs; found out where it is not given.
        uint32_t sharedMemoryDevice = UINT32_MAX;
        // Whether figures may come from page tables where they suffice; else always from smaps. For tests and
        // benchmarks.
        bool mayScanPageTables = true;
    };
    // Touches no system.
    HXLinuxPlatform() : HXLinuxPlatform(Setting()) {}
    explicit HXLinuxPlatform(const Setting &setting);

    // Readies the running process for examining thousands of others: as many open files as it may have, no
    // file of its own on the descriptors of the standard streams, should one be closed, a standard output
    // that remembers what is lost of it, and a message of `program` and status 1 as the end when memory runs
    // out. For main; `program` lives for ever.
    static void prepareProcess(const char *program);

    mach_port_t mach_task_self() override { return kSelfPort; }
    kern_return_t task_for_pid(mach_port_t self, int32_t pid, mach_port_t *task) override;
    void mach_port_deallocate(mach_port_t self, mach_port_t task) override;
    kern_return_t mach_vm_region(mach_port_t task, uint64_t *address, uint64_t *size, int32_t flavor,
                                 vm_region_basic_info_64 *info, uint32_t *infoCount) override;
    kern_return_t mach_vm_region_recurse(mach_port_t task, uint64_t *address, uint64_t *size,
                                         uint32_t *nestingDepth, vm_region_submap_info_64 *info,
                                         uint32_t *infoCount) override;
    kern_return_t mach_vm_page_range_query(mach_port_t task, uint64_t address, uint64_t size,
                                           std::vector<vm_page_run> *runs, uint64_t *pages) override;
    kern_return_t mach_vm_purgable_control(mach_port_t, uint64_t, int32_t, int32_t *) override {
        return KERN_INVALID_ARGUMENT; // nothing is purgeable here
    }
    std::vector<int32_t> examineTogether(const std::function<bool()> &isCancelled) override;
    std::optional<uint64_t> sharedSizeNotTold() override { return _sharedSizeNotTold; }
    std::vector<vm_region_share> mach_vm_region_shares(mach_port_t task, uint64_t address) override;
    std::optional<HXWalkDifference> walkDifference(mach_port_t task) override;
    uint64_t pageTableObject(mach_port_t task) override;
    std::vector<task_held_object> task_held_objects(mach_port_t task) override;
    std::vector<task_held_object> proc_held_objects(int32_t pid) override;
    std::vector<task_held_object> host_held_objects(mach_port_t) override { return _held.ofKernel(); }
    uint32_t vm_kernel_page_size() override { return _pageSize; }
    bool hasSharedRegion() override { return false; }

    int32_t proc_listallpids(int32_t *pids, uint32_t bufferBytes) override {
        return _processes.proc_listallpids(pids, bufferBytes);
    }
    std::optional<std::string> processesNotTold(bool ofAll) override { return _processes.notTold(ofAll); }
    // The kernel's record, then by resident memory.
    uint64_t expectedCost(int32_t pid) override;
    int32_t proc_pidinfo(int32_t pid, int32_t flavor, uint64_t, void *buffer, uint32_t bufferBytes) override {
        return _processes.proc_pidinfo(pid, flavor, buffer, bufferBytes);
    }
    int32_t proc_pid_rusage(int32_t pid, int32_t flavor, rusage_info_v4 *info) override;
    int32_t proc_get_dirty(int32_t pid, uint32_t *flags) override;
    int32_t proc_regionfilename(int32_t pid, uint64_t address, char *buffer, uint32_t bufferBytes) override;
    bool isNamedByRecord(const proc_bsdinfo &info) override {
        return HXLinuxProcesses::isNamedByRecord(info);
    }
    bool mayBeNamed(const proc_bsdinfo &info, std::string_view name) override {
        return HXLinuxProcesses::mayBeNamed(info, name);
    }
    int32_t getpid() override { return _processes.ownPid(); }
    // "Linux RELEASE, X86-64".
    std::string hostDescription() override;
    uint32_t geteuid() override { return ::geteuid(); }
    int32_t sysctl(const int32_t *name, uint32_t nameLength, void *old, size_t *oldBytes) override;
    int32_t sysctlbyname(const char *name, void *old, size_t *oldBytes, const void *newValue,
                         size_t newBytes) override;
    int32_t ledger(int32_t command, int32_t pid, void *buffer, int64_t *count) override;

    RVSymbolicator *RVSymbolicatorCreateWithTaskFlagsAndNotification(mach_port_t task, uint32_t flags,
                                                                     const void *notification) override;
    void
    RVSymbolicatorForeachSymbolOwnerAtTime(RVSymbolicator *symbolicator, uint64_t time,
                                           const std::function<void(const RVSymbolOwner &)> &each) override;
    // The kernel names mapped files without links.
    std::string stringByResolvingSymlinksInPath(const std::string &path) override { return path; }
    RVSymbolicator *RVSymbolicatorCreateWithMachKernelFlagsAndNotification(uint32_t flags,
                                                                           const void *n) override {
        return _kernelMemory.RVSymbolicatorCreateWithMachKernelFlagsAndNotification(flags, n);
    }
    RVSymbol RVSymbolicatorGetSymbolWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                      uint64_t time) override {
        return _kernelMemory.RVSymbolicatorGetSymbolWithAddressAtTime(symbolicator, address, time);
    }
    RVSourceInfo RVSymbolicatorGetSourceInfoWithAddressAtTime(RVSymbolicator *symbolicator, uint64_t address,
                                                              uint64_t time) override {
        return _kernelMemory.RVSymbolicatorGetSourceInfoWithAddressAtTime(symbolicator, address, time);
    }
    void RVRelease(RVSymbolicator *symbolicator) override { _kernelMemory.RVRelease(symbolicator); }

    mach_port_t mach_host_self() override { return kHostPort; }
    kern_return_t mach_memory_info(mach_port_t host, mach_zone_name **names, uint32_t *nameCount,
                                   mach_zone_info **zones, uint32_t *zoneCount,
                                   mach_memory_info_record **records, uint32_t *recordCount) override {
        return _kernelMemory.mach_memory_info(host, names, nameCount, zones, zoneCount, records, recordCount);
    }
    kern_return_t vm_deallocate(mach_port_t task, const void *address, uint64_t bytes) override {
        return _kernelMemory.vm_deallocate(task, address, bytes);
    }
    std::vector<OSKextInfo> OSKextCopyLoadedKextInfo() override {
        return _kernelMemory.OSKextCopyLoadedKextInfo();
    }
    std::optional<std::string> GXRegionTypeDescriptionForTagShareProtAndPager(uint32_t tag, uint8_t shareMode,
                                                                              int32_t protection,
                                                                              uint8_t pager) override;

    HXLinuxServices &services() override { return _services; }
    // Whether a thread may still be using this platform (HXLinuxServices::hasGivenUp).
    bool hasGivenUp() const { return _services.hasGivenUp(); }

  private:
    static constexpr mach_port_t kSelfPort = 1, kHostPort = 2; // below those of tasks

    kern_return_t openTask(int32_t pid, bool asListed, std::unique_ptr<HXLinuxTask> *task);
    const HXAddressSpace &addressSpaceOf(HXLinuxTask *task);
    // The first mapping whose end lies above *address, of which it stores the place; null with *error.
    const HXMapping *mappingAt(HXLinuxTask *task, uint64_t *address, uint64_t *size, kern_return_t *error);
    vm_region_submap_info_64 infoOf(HXLinuxTask *task, const HXMapping &mapping);
    std::optional<HXStatusRecord> statusOf(int32_t pid, HXLinuxTask::StatusUse use);

    const uint32_t _pageSize;
    const std::string _sysPath;
    HXFileSystems _fileSystems;
    HXMachineFacts _machine;
    const HXReaderSetting _readerSetting;
    HXImageHeaders _imageHeaders;
    HXLinuxProcesses _processes;
    HXLinuxKernelMemory _kernelMemory;
    HXDescriptorTurns _turns;
    HXObjectIdentifiers _identifiers;
    HXHeldObjects _held;
    HXTaskTable _tasks;
    std::optional<uint64_t> _sharedSizeNotTold; // of the last `examineTogether`
    std::atomic<uint32_t> _reportsCharge = 0;   // "vm.self_region_heft"
    HXLinuxServices _services;
};
